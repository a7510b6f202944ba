# Options that every target of the project shares: the language, the warnings and the sanitizers.
set(CMAKE_CXX_STANDARD 20)
set(CMAKE_CXX_STANDARD_REQUIRED ON)
set(CMAKE_CXX_EXTENSIONS OFF)
set(CMAKE_POSITION_INDEPENDENT_CODE ON)

# At -O3 GCC 12 takes the inactive alternative of a std::variant for an uninitialised one, and a
# literal joined to a string for an overlapping copy.
if(CMAKE_CXX_COMPILER_ID STREQUAL GNU AND CMAKE_CXX_COMPILER_VERSION VERSION_LESS 13)
  set(QUARVEL_NO_FALSE_WARNINGS $<$<CONFIG:Release>:-Wno-maybe-uninitialized;-Wno-restrict>)
endif()

add_library(quarvel_options INTERFACE)
target_include_directories(quarvel_options INTERFACE ${PROJECT_SOURCE_DIR})
target_compile_options(quarvel_options INTERFACE
  -Wall -Wextra -Wpedantic -Wshadow -Wnon-virtual-dtor -Woverloaded-virtual -Wconversion
  -Wsign-conversion -Wold-style-cast -Wcast-qual -Wformat=2 -Wundef
  $<$<BOOL:${QUARVEL_WERROR}>:-Werror>
  $<$<CXX_COMPILER_ID:Clang>:-Wthread-safety>
  ${QUARVEL_NO_FALSE_WARNINGS})
if(QUARVEL_SANITIZE)
  target_compile_options(quarvel_options INTERFACE
    -fsanitize=${QUARVEL_SANITIZE} -fno-sanitize-recover=all -fno-omit-frame-pointer)
  target_link_options(quarvel_options INTERFACE -fsanitize=${QUARVEL_SANITIZE})
endif()

# Half of a build's time goes into the standard library's headers. The sanitizer builds read them once. The
# release build does not, so that it finds a missing include.
function(quarvel_precompile NAME)
  if(NOT QUARVEL_SANITIZE)
    return()
  endif()
  # Clang wants programs apart from libraries.
  get_target_property(KIND ${NAME} TYPE)
  if(NAME STREQUAL quarvel_base OR KIND STREQUAL EXECUTABLE)
    target_precompile_headers(${NAME} PRIVATE <algorithm> <chrono> <filesystem> <functional> <map> <memory>
      <optional> <string> <system_error> <variant> <vector> <fmt/format.h>)
  else()
    target_precompile_headers(${NAME} REUSE_FROM quarvel_base)
  endif()
endfunction()

# quarvel_library(NAME SOURCES … LINKS …): the static library of a folder; LINKS are its PUBLIC dependencies.
function(quarvel_library NAME)
  cmake_parse_arguments(ARG "" "" "SOURCES;LINKS;PRIVATE_LINKS" ${ARGN})
  add_library(${NAME} STATIC ${ARG_SOURCES})
  target_link_libraries(${NAME} PUBLIC ${ARG_LINKS} PRIVATE quarvel_options ${ARG_PRIVATE_LINKS})
  target_include_directories(${NAME} PUBLIC $<BUILD_INTERFACE:${PROJECT_SOURCE_DIR}>)
  quarvel_precompile(${NAME})
endfunction()

# quarvel_test(NAME SOURCES … LINKS … [TIMEOUT seconds] [LABELS label]): a GoogleTest program, which ctest
# runs case by case.
function(quarvel_test NAME)
  cmake_parse_arguments(ARG "" "TIMEOUT;LABELS" "SOURCES;LINKS" ${ARGN})
  if(NOT ARG_TIMEOUT)
    set(ARG_TIMEOUT 120)
  endif()
  add_executable(${NAME} ${ARG_SOURCES})
  target_link_libraries(${NAME} PRIVATE quarvel_options ${ARG_LINKS} GTest::gmock GTest::gtest_main)
  # Tests take half of a clean build, nearly all of it for GoogleTest's headers.
  target_compile_options(${NAME} PRIVATE -O0)
  if(NAME STREQUAL base_test)
    target_precompile_headers(${NAME} PRIVATE <fmt/format.h> <gmock/gmock.h> <gtest/gtest.h>)
  else()
    target_precompile_headers(${NAME} REUSE_FROM base_test)
  endif()
  gtest_discover_tests(${NAME} PROPERTIES TIMEOUT ${ARG_TIMEOUT} LABELS "${ARG_LABELS}" DISCOVERY_TIMEOUT 60)
  # Under valgrind a start takes seconds, so that all cases run in one process: ctest -C valgrind.
  add_test(NAME ${NAME}.at_once CONFIGURATIONS valgrind COMMAND ${NAME} --gtest_brief=1)
  set_tests_properties(${NAME}.at_once PROPERTIES TIMEOUT 1800 COST 100)
endfunction()
