# The Debian packages, made by scripts/package: one for each component of Install.cmake.
set(QUARVEL_PACKAGING ${PROJECT_SOURCE_DIR}/packaging/debian)
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
# Each package has a summary of its own.
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "")
set(CPACK_PACKAGE_CONTACT "Quarvel maintainers <maintainers@quarvel.example>")
# The same sources make the same packages, byte for byte: every date is the changelog's.
file(STRINGS ${QUARVEL_PACKAGING}/changelog CHANGED REGEX "^ -- " LIMIT_COUNT 1)
string(REGEX REPLACE ".*>  " "" CHANGED "${CHANGED}")
execute_process(COMMAND date --date=${CHANGED} +%s
  OUTPUT_VARIABLE CHANGED OUTPUT_STRIP_TRAILING_WHITESPACE COMMAND_ERROR_IS_FATAL ANY)
file(CONFIGURE OUTPUT ${PROJECT_BINARY_DIR}/packaging/date.cmake
  CONTENT "set(ENV{SOURCE_DATE_EPOCH} ${CHANGED})\n")
set(CPACK_PROJECT_CONFIG_FILE ${PROJECT_BINARY_DIR}/packaging/date.cmake)
set(CPACK_PACKAGE_DIRECTORY ${PROJECT_BINARY_DIR}/packages)
set(CPACK_COMPONENTS_ALL service tools library development)
set(CPACK_COMPONENTS_GROUPING IGNORE)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_STRIP_FILES ON)
# Configuration is outside the prefix.
set(CPACK_SET_DESTDIR ON)
set(CPACK_INSTALL_PREFIX ${CMAKE_INSTALL_PREFIX})
set(CPACK_INSTALL_DEFAULT_DIRECTORY_PERMISSIONS
  OWNER_READ OWNER_WRITE OWNER_EXECUTE GROUP_READ GROUP_EXECUTE WORLD_READ WORLD_EXECUTE)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)

# quarvel_package(COMPONENT NAME SECTION DESCRIPTION [DEPENDS …] [RECOMMENDS …] [CONTROL files])
function(quarvel_package COMPONENT NAME SECTION DESCRIPTION)
  cmake_parse_arguments(ARG "" "DEPENDS;RECOMMENDS" "CONTROL" ${ARGN})
  string(TOUPPER ${COMPONENT} KEY)
  set(CPACK_DEBIAN_${KEY}_PACKAGE_NAME ${NAME} PARENT_SCOPE)
  set(CPACK_DEBIAN_${KEY}_PACKAGE_SECTION ${SECTION} PARENT_SCOPE)
  set(CPACK_COMPONENT_${KEY}_DESCRIPTION "${DESCRIPTION}" PARENT_SCOPE)
  set(CPACK_DEBIAN_${KEY}_PACKAGE_DEPENDS "${ARG_DEPENDS}" PARENT_SCOPE)
  set(CPACK_DEBIAN_${KEY}_PACKAGE_RECOMMENDS "${ARG_RECOMMENDS}" PARENT_SCOPE)
  list(TRANSFORM ARG_CONTROL PREPEND ${QUARVEL_PACKAGING}/)
  set(CPACK_DEBIAN_${KEY}_PACKAGE_CONTROL_EXTRA "${ARG_CONTROL}" PARENT_SCOPE)
  install(FILES ${QUARVEL_PACKAGING}/copyright ${PROJECT_BINARY_DIR}/packaging/changelog.gz
    DESTINATION share/doc/${NAME} COMPONENT ${COMPONENT})
endfunction()

quarvel_package(service quarvel sound "on-device audio telemetry service
quarveld collects what the audio stack has to tell: players, telephony,
assistants and haptics open reporting sessions over a local socket and send
messages, which it keeps in a database on the device, in order and without
loss. It is started by its first client and costs nothing while nothing
happens."
  DEPENDS "systemd | systemd-sysusers, systemd | systemd-tmpfiles, quarvel-tools (>= ${PROJECT_VERSION})"
  CONTROL conffiles postinst postrm prerm)
quarvel_package(tools quarvel-tools sound "command line of the audio telemetry service
quarvelctl lists sessions, messages and events in the store, follows them as
they come, tells what a session was, changes preferences, and plays scripts of
calls to the service."
  RECOMMENDS "quarvel")
quarvel_package(library libquarvel1 libs "client library of the audio telemetry service
With libquarvel a program of the audio stack opens reporting sessions at the
service and sends it messages."
  CONTROL shlibs triggers)
install(FILES ${QUARVEL_PACKAGING}/libquarvel1.lintian-overrides
  DESTINATION share/lintian/overrides RENAME libquarvel1 COMPONENT library)
quarvel_package(development libquarvel-dev libdevel "client library of the audio telemetry service: development files
With libquarvel a program of the audio stack opens reporting sessions at the
service and sends it messages. This is what building such a program needs: the
headers, a CMake package and a pkg-config file."
  DEPENDS "libquarvel1 (= ${PROJECT_VERSION})")
set(CPACK_COMPONENT_DEVELOPMENT_DEPENDS library)
include(CPack)

# Compresses a file for the installation; -n leaves out name and time, so that each build makes the same.
# quarvel_compressed(SOURCE NAME)
function(quarvel_compressed SOURCE NAME)
  set(COMPRESSED ${PROJECT_BINARY_DIR}/packaging/${NAME}.gz)
  add_custom_command(OUTPUT ${COMPRESSED}
    COMMAND ${CMAKE_COMMAND} -E make_directory ${PROJECT_BINARY_DIR}/packaging
    COMMAND gzip -9nc ${SOURCE} > ${COMPRESSED}
    DEPENDS ${SOURCE} VERBATIM)
  set_property(GLOBAL APPEND PROPERTY QUARVEL_COMPRESSED ${COMPRESSED})
endfunction()

quarvel_compressed(${QUARVEL_PACKAGING}/changelog changelog)
# quarvel_manual(COMPONENT PAGES …)
function(quarvel_manual COMPONENT)
  foreach(PAGE IN LISTS ARGN)
    cmake_path(GET PAGE EXTENSION LAST_ONLY SECTION)
    string(SUBSTRING ${SECTION} 1 1 SECTION)
    quarvel_compressed(${PROJECT_SOURCE_DIR}/docs/man/${PAGE} ${PAGE})
    install(FILES ${PROJECT_BINARY_DIR}/packaging/${PAGE}.gz
      DESTINATION ${CMAKE_INSTALL_MANDIR}/man${SECTION} COMPONENT ${COMPONENT})
  endforeach()
endfunction()
quarvel_manual(service quarveld.8 quarvel.toml.5)
quarvel_manual(tools quarvelctl.1)
quarvel_manual(development quarvel.3)
get_property(COMPRESSED GLOBAL PROPERTY QUARVEL_COMPRESSED)
add_custom_target(compressed ALL DEPENDS ${COMPRESSED})
