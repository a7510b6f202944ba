# Installs the receiver and its packages into TO, once for each version of the list of packages.
file(SHA256 ${FROM}/package-lock.json wanted)
set(installed "")
if(EXISTS ${TO}/installed)
  file(READ ${TO}/installed installed)
endif()
file(COPY ${FROM}/package.json ${FROM}/package-lock.json ${FROM}/receiver.js DESTINATION ${TO})
if(NOT installed STREQUAL wanted)
  execute_process(COMMAND npm ci --ignore-scripts --no-audit --no-fund
    WORKING_DIRECTORY ${TO} COMMAND_ERROR_IS_FATAL ANY)
  file(WRITE ${TO}/installed ${wanted})
endif()
