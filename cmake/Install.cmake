# The installation, in the components that become packages (Packages.cmake): service, tools, library,
# development.
include(CMakePackageConfigHelpers)

# The service and its units.
install(TARGETS quarveld RUNTIME DESTINATION ${CMAKE_INSTALL_SBINDIR} COMPONENT service)
configure_file(packaging/systemd/quarvel.service.in ${PROJECT_BINARY_DIR}/quarvel.service @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/quarvel.service packaging/systemd/quarvel.socket
  DESTINATION lib/systemd/system COMPONENT service)
install(FILES packaging/systemd/sysusers.conf
  DESTINATION lib/sysusers.d RENAME quarvel.conf COMPONENT service)
install(FILES packaging/systemd/tmpfiles.conf
  DESTINATION lib/tmpfiles.d RENAME quarvel.conf COMPONENT service)
# Configuration is in /etc when the prefix is /usr, else below the prefix, which --prefix may change.
install(CODE "
  if(CMAKE_INSTALL_PREFIX STREQUAL \"/usr\")
    set(configuration /etc/quarvel)
  else()
    set(configuration \${CMAKE_INSTALL_PREFIX}/etc/quarvel)
  endif()
  file(INSTALL DESTINATION \${configuration} TYPE FILE
    FILES ${PROJECT_SOURCE_DIR}/packaging/quarvel.toml)" COMPONENT service)
install(DIRECTORY examples/ DESTINATION ${CMAKE_INSTALL_DOCDIR}/examples COMPONENT service)
install(DIRECTORY docs/ DESTINATION ${CMAKE_INSTALL_DOCDIR} COMPONENT service
  PATTERN man EXCLUDE)

install(TARGETS quarvelctl RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT tools)
install(FILES packaging/completion/quarvelctl.bash
  DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions RENAME quarvelctl COMPONENT tools)
install(FILES packaging/completion/_quarvelctl
  DESTINATION ${CMAKE_INSTALL_DATADIR}/zsh/vendor-completions COMPONENT tools)

# libquarvel, found with CMake's find_package(quarvel) or with pkg-config.
install(TARGETS quarvel EXPORT quarvel LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR}
  COMPONENT library NAMELINK_COMPONENT development)
install(DIRECTORY client/include/quarvel DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} COMPONENT development)
# Headers of base/ that the client's headers include. The installed copies include each other as neighbours,
# so that a user's include path needs no folder of so common a name as base/.
foreach(HEADER Date Error Json MessagePackForm Payload Value Vocabulary)
  set(INSTALLED ${PROJECT_BINARY_DIR}/include/quarvel/base/${HEADER}.h)
  set_property(DIRECTORY APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS base/${HEADER}.h)
  file(READ base/${HEADER}.h TEXT)
  string(REPLACE "#include \"base/" "#include \"" TEXT "${TEXT}")
  file(CONFIGURE OUTPUT ${INSTALLED} CONTENT "${TEXT}" @ONLY)
  install(FILES ${INSTALLED} DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/quarvel/base COMPONENT development)
endforeach()

set(QUARVEL_CMAKE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/quarvel)
install(EXPORT quarvel FILE quarvelConfig.cmake NAMESPACE quarvel::
  DESTINATION ${QUARVEL_CMAKE_DIR} COMPONENT development)
write_basic_package_version_file(${PROJECT_BINARY_DIR}/quarvelConfigVersion.cmake
  COMPATIBILITY SameMinorVersion)
install(FILES ${PROJECT_BINARY_DIR}/quarvelConfigVersion.cmake
  DESTINATION ${QUARVEL_CMAKE_DIR} COMPONENT development)

configure_file(cmake/quarvel.pc.in ${PROJECT_BINARY_DIR}/quarvel.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/quarvel.pc
  DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig COMPONENT development)
