# Installs the receiver and its packages into TO, anew when package.json has changed.
file(SHA256 ${FROM}/package.json wanted)
set(installed "")
if(EXISTS ${TO}/installed)
  file(READ ${TO}/installed installed)
endif()
file(COPY ${FROM}/package.json ${FROM}/receiver.js DESTINATION ${TO})
if(NOT installed STREQUAL wanted)
  file(REMOVE_RECURSE ${TO}/node_modules)
  execute_process(COMMAND npm install --ignore-scripts --no-audit --no-fund --no-package-lock
    WORKING_DIRECTORY ${TO} COMMAND_ERROR_IS_FATAL ANY)
  file(WRITE ${TO}/installed ${wanted})
endif()
