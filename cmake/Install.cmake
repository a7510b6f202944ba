# What is installed, in two components: the service with its tools, and libquarvel, which others find
# with CMake's find_package(quarvel) or with pkg-config.
include(CMakePackageConfigHelpers)

if(TARGET quarveld)
  install(TARGETS quarveld RUNTIME DESTINATION ${CMAKE_INSTALL_SBINDIR} COMPONENT service)
endif()
install(DIRECTORY examples/ DESTINATION ${CMAKE_INSTALL_DOCDIR}/examples COMPONENT service)
install(TARGETS quarvelctl RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT service)
install(TARGETS quarvel EXPORT quarvel LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} COMPONENT client)

install(DIRECTORY client/include/quarvel DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} COMPONENT client)
# The values that the client's header speaks of.
install(FILES base/Date.h base/Error.h base/Json.h base/Payload.h base/Value.h
  DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}/quarvel/base COMPONENT client)

set(QUARVEL_CMAKE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/quarvel)
install(EXPORT quarvel FILE quarvelConfig.cmake NAMESPACE quarvel::
  DESTINATION ${QUARVEL_CMAKE_DIR} COMPONENT client)
write_basic_package_version_file(${PROJECT_BINARY_DIR}/quarvelConfigVersion.cmake
  COMPATIBILITY SameMinorVersion)
install(FILES ${PROJECT_BINARY_DIR}/quarvelConfigVersion.cmake
  DESTINATION ${QUARVEL_CMAKE_DIR} COMPONENT client)

configure_file(cmake/quarvel.pc.in ${PROJECT_BINARY_DIR}/quarvel.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/quarvel.pc
  DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig COMPONENT client)
