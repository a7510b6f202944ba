# Installs the library's component into a fresh directory, builds a program against it alone, runs it.
# Variables: BUILD (the build directory), SOURCE (the program), CXX (the compiler).
set(work ${BUILD}/install_test)
file(REMOVE_RECURSE ${work})

function(run)
  execute_process(COMMAND ${ARGV} OUTPUT_VARIABLE output ERROR_VARIABLE output RESULT_VARIABLE status)
  if(status)
    message(FATAL_ERROR "${ARGV}\n${output}")
  endif()
  set(output "${output}" PARENT_SCOPE)
endfunction()

run(${CMAKE_COMMAND} --install ${BUILD} --component client --prefix ${work}/prefix)
run(${CMAKE_COMMAND} -S ${SOURCE} -B ${work}/build -DCMAKE_CXX_COMPILER=${CXX}
  -DCMAKE_PREFIX_PATH=${work}/prefix -DCMAKE_BUILD_TYPE=Debug)
run(${CMAKE_COMMAND} --build ${work}/build)
run(${work}/build/consumer)

foreach(expected "{\"Route\":\"Speaker\",\"Rates\":[44100,48000]}" "HAL_Playback" "quarvel.client 1: ")
  string(FIND "${output}" "${expected}" found)
  if(found EQUAL -1)
    message(FATAL_ERROR "expected ${expected} in\n${output}")
  endif()
endforeach()
