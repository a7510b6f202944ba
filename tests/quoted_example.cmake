# Fails unless DOCUMENT quotes EXAMPLE to the letter, as a code block of the language LANGUAGE.
file(READ ${DOCUMENT} document)
file(READ ${EXAMPLE} example)
string(FIND "${document}" "```${LANGUAGE}\n${example}```\n" found)
if(found EQUAL -1)
  message(FATAL_ERROR "${DOCUMENT} does not quote ${EXAMPLE} as it stands")
endif()
