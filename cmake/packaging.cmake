# Debian packages through CPack: "vantrel" (the daemon, the tools, the
# client library's shared object, units, completion, manual pages) and
# "vantrel-dev" (headers, pkg-config and CMake files to build hosts).
# scripts/package runs it: vantrel_<version>_<arch>.deb and
# vantrel-dev_<version>_<arch>.deb.
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME vantrel)
set(CPACK_PACKAGE_VENDOR "vantrel")
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "plug-in registry daemon")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_DEBIAN_PACKAGE_MAINTAINER "vantrel developers <vantrel@localhost>")
set(CPACK_DEBIAN_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL runtime development)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_NAME vantrel)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_RUNTIME_DESCRIPTION
  "plug-in registry daemon\n vantreld keeps the registry of application plug-ins, answers discovery\n queries from host processes and prepares plug-ins for their use;\n vantrelctl is its command line.")
set(CPACK_DEBIAN_RUNTIME_PACKAGE_CONTROL_EXTRA
  ${PROJECT_SOURCE_DIR}/dist/debian/postinst
  ${PROJECT_SOURCE_DIR}/dist/debian/prerm
  ${PROJECT_SOURCE_DIR}/dist/debian/postrm)
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_NAME vantrel-dev)
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_DEPENDS "vantrel (= ${PROJECT_VERSION})")
set(CPACK_DEBIAN_DEVELOPMENT_DESCRIPTION
  "plug-in registry client library: development files\n Headers, pkg-config and CMake package files for host programs that\n link libvantrel-client.")
include(CPack)
