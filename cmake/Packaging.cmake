# What `cmake --install` lays out and what the .deb (CPack, scripts/package) holds:
#   lib/qaxagent/qaxagent            the daemon (started by the service manager, not by people)
#   bin/qaxctl, bin/coverage-sim     the tools
#   share/qaxagent/                  launch configuration, user-interface strings, demo/
#   lib/systemd/user/                the socket, service and wake-up timer units
#   share/man/man1, man8             qaxctl(1), coverage-sim is described there too; qaxagent(8)

set(QAX_VERSION 0.1.0)
set(QAX_AGENT_INSTALL_DIR lib/qaxagent)
set(QAX_USER_UNIT_DIR lib/systemd/user)

install(TARGETS qaxagent RUNTIME DESTINATION ${QAX_AGENT_INSTALL_DIR})
install(TARGETS qaxctl RUNTIME DESTINATION bin)
if(TARGET coverage-sim)
  install(TARGETS coverage-sim RUNTIME DESTINATION bin)
endif()

# The share directory the programs find beside them (see installedShareDirectory).
install(DIRECTORY ${PROJECT_SOURCE_DIR}/share/qaxagent/ DESTINATION share/qaxagent OPTIONAL)
install(DIRECTORY ${PROJECT_SOURCE_DIR}/share/demo/ DESTINATION share/qaxagent/demo)

# The service unit names the daemon by its installed path, which is known only at install time
# (`cmake --install --prefix` may change it).
set(QAX_UNIT_STAGING ${PROJECT_BINARY_DIR}/systemd)
install(CODE "
  set(QAX_AGENT_PATH \"\${CMAKE_INSTALL_PREFIX}/${QAX_AGENT_INSTALL_DIR}/qaxagent\")
  configure_file(\"${PROJECT_SOURCE_DIR}/share/systemd/qaxagent.service.in\"
                 \"${QAX_UNIT_STAGING}/qaxagent.service\" @ONLY)
")
install(FILES
  ${QAX_UNIT_STAGING}/qaxagent.service
  ${PROJECT_SOURCE_DIR}/share/systemd/qaxagent.socket
  ${PROJECT_SOURCE_DIR}/share/systemd/qaxagent-wake.timer
  DESTINATION ${QAX_USER_UNIT_DIR})

install(FILES ${PROJECT_SOURCE_DIR}/share/man/qaxctl.1 DESTINATION share/man/man1)
install(FILES ${PROJECT_SOURCE_DIR}/share/man/qaxagent.8 DESTINATION share/man/man8)

# The .deb: shared-library dependencies are worked out from the installed programs by
# dpkg-shlibdeps, so they name exactly the Debian packages this build linked against.
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME qaxagent)
set(CPACK_PACKAGE_VERSION ${QAX_VERSION})
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "device warranty and coverage agent, with qaxctl")
set(CPACK_PACKAGE_DESCRIPTION
    "qaxagent keeps track of the warranty and paid-coverage status of the user's devices, \
caches coverage summaries, serves entitled clients over a Unix socket and runs background \
activities. It is started on demand by the user's service manager (socket and timer units) \
and exits when idle. qaxctl is its client and engineering tool; coverage-sim is a local \
coverage service for trying it out.")
set(CPACK_PACKAGE_CONTACT "qaxagent developers <qaxagent@localhost>")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION utils)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
# The agent trusts the system's CAs for the coverage service; the units need the service manager.
# libcurl and ICU are loaded on first use (dlopen), so dpkg-shlibdeps cannot see them: they are
# named here. ICU's package carries the major version the agent was built against.
string(REGEX MATCH "^[0-9]+" QAX_ICU_MAJOR "${ICU_VERSION}")
set(CPACK_DEBIAN_PACKAGE_DEPENDS "ca-certificates, libcurl4 (>= 7.88), libicu${QAX_ICU_MAJOR}")
set(CPACK_DEBIAN_PACKAGE_RECOMMENDS "systemd")
set(CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA
    ${PROJECT_SOURCE_DIR}/share/debian/postinst
    ${PROJECT_SOURCE_DIR}/share/debian/prerm)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
include(CPack)
