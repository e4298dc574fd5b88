# Debian packages, one a component: cpack --config build/CPackConfig.cmake
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_CONTACT "The vex_log_manage maintainers <maintainers@localhost>")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_COMPONENTS_ALL daemon)
if(VEX_TOOL)
  list(APPEND CPACK_COMPONENTS_ALL tool)
endif()
if(VEX_SERVER)
  list(APPEND CPACK_COMPONENTS_ALL server)
endif()
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_COMPRESSION_TYPE xz)

set(CPACK_DEBIAN_DAEMON_PACKAGE_NAME vex-log-manage)
set(CPACK_DEBIAN_DAEMON_PACKAGE_SECTION admin)
set(CPACK_COMPONENT_DAEMON_DESCRIPTION
  "control and collection of a device's diagnostic logs\nRuns on the device and serves a log tool, or calls its log server.")
if(NOT VEX_TLS_LINKED)
  set(CPACK_DEBIAN_DAEMON_PACKAGE_DEPENDS libssl3) # which it loads by name
endif()
set(CPACK_DEBIAN_DAEMON_PACKAGE_CONTROL_EXTRA ${PROJECT_SOURCE_DIR}/packaging/debian/postinst
  ${PROJECT_SOURCE_DIR}/packaging/debian/prerm)

set(CPACK_DEBIAN_TOOL_PACKAGE_NAME vex-log-tool)
set(CPACK_DEBIAN_TOOL_PACKAGE_SECTION net)
set(CPACK_COMPONENT_TOOL_DESCRIPTION
  "controls and collects the diagnostic logs of a device\nThe PC side of vex-log-manage.")

set(CPACK_DEBIAN_SERVER_PACKAGE_NAME vex-log-server)
set(CPACK_DEBIAN_SERVER_PACKAGE_SECTION net)
set(CPACK_DEBIAN_SERVER_PACKAGE_RECOMMENDS vex-log-tool)
set(CPACK_COMPONENT_SERVER_DESCRIPTION
  "log server of a fleet of devices\nDevices with vex-log-manage call it, vex-log-tool reaches them through it.")
include(CPack)
