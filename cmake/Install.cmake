# `cmake --install`: both libraries, the public headers, the tool with its man
# page and completion, a pkg-config file and a CMake package; `make package`
# wraps the same tree in a .deb.
include(CMakePackageConfigHelpers)

set(GW_CMAKE_PACKAGE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/GWArchiveSupport)

install(TARGETS GWArchiveSupportStatic GWArchiveSupportShared EXPORT GWArchiveSupportTargets
  ARCHIVE DESTINATION ${CMAKE_INSTALL_LIBDIR}
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} NAMELINK_COMPONENT Unspecified
  INCLUDES DESTINATION ${CMAKE_INSTALL_INCLUDEDIR})
install(DIRECTORY ${PROJECT_SOURCE_DIR}/include/GWArchiveSupport
  DESTINATION ${CMAKE_INSTALL_INCLUDEDIR} FILES_MATCHING PATTERN "*.h")
install(TARGETS gwarchive RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
install(FILES ${PROJECT_SOURCE_DIR}/tools/gwarchive/gwarchive.1
  DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)
install(FILES ${PROJECT_SOURCE_DIR}/tools/gwarchive/gwarchive.bash-completion
  DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/bash-completion/completions RENAME gwarchive)

install(EXPORT GWArchiveSupportTargets NAMESPACE GWArchiveSupport::
  DESTINATION ${GW_CMAKE_PACKAGE_DIR})
configure_package_config_file(${CMAKE_CURRENT_LIST_DIR}/GWArchiveSupportConfig.cmake.in
  ${PROJECT_BINARY_DIR}/GWArchiveSupportConfig.cmake INSTALL_DESTINATION ${GW_CMAKE_PACKAGE_DIR})
write_basic_package_version_file(${PROJECT_BINARY_DIR}/GWArchiveSupportConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${PROJECT_BINARY_DIR}/GWArchiveSupportConfig.cmake
  ${PROJECT_BINARY_DIR}/GWArchiveSupportConfigVersion.cmake DESTINATION ${GW_CMAKE_PACKAGE_DIR})

# The .pc file finds the prefix from its own place, so the same file serves
# any prefix the tree is installed or packaged under.
file(RELATIVE_PATH GW_PC_PREFIX_FROM_PCFILEDIR /${CMAKE_INSTALL_LIBDIR}/pkgconfig /)
configure_file(${CMAKE_CURRENT_LIST_DIR}/GWArchiveSupport.pc.in
  ${PROJECT_BINARY_DIR}/GWArchiveSupport.pc @ONLY)
install(FILES ${PROJECT_BINARY_DIR}/GWArchiveSupport.pc
  DESTINATION ${CMAKE_INSTALL_LIBDIR}/pkgconfig)

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME gwarchivesupport)
set(CPACK_PACKAGE_VENDOR "GWArchiveSupport")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY
  "ZIP and XAR archive library (static, shared, headers) and the gwarchive tool")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_MAINTAINER "GWArchiveSupport developers <gwarchivesupport@localhost>")
set(CPACK_DEBIAN_PACKAGE_SECTION libs)
# Runtime dependencies come from the binaries themselves; the development
# packages matter only to programs built against the headers and libraries.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_SUGGESTS
  "libacl1-dev, libpugixml-dev, zlib1g-dev, libbz2-dev, liblzma-dev, libzstd-dev, libssl-dev, libcurl4-openssl-dev, libisal-dev, pkg-config")
include(CPack)
