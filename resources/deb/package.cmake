# The Debian package (cpack -G DEB, run by `make deb`): what `make install` installs, with the
# home in /usr/lib/q7agent/ and the parts that change moved to Debian's places by stage.cmake:
# configuration in /etc/q7agent (conffiles), data in /var/lib/q7agent, the trace in
# /var/log/q7agent. The maintainer scripts beside this file add the q7agent user and the
# directories it owns. Included at the end of the top-level CMakeLists.txt.

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME q7agent)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_CONTACT "q7agent maintainers <maintainers@q7agent.example>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "response-time monitoring agent for web traffic")
# CPack puts the summary line first.
set(CPACK_DEBIAN_PACKAGE_DESCRIPTION "q7agent runs beside a passive web-traffic collector
(simulated, on the wire or from a web server's access log), matches each web transaction
against operator-defined patterns, aggregates response times into over-time and summary
tables, keeps history across restarts and serves its tables, percentiles and Prometheus
metrics over a local HTTP API and the q7ctl command line.")
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION net)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
# dpkg-shlibdeps computes the libraries' packages; the maintainer scripts need adduser.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_DEPENDS adduser)
set(CPACK_STRIP_FILES ON)

# The home: CPack installs the project under it, as `make install PREFIX=...` would.
set(CPACK_PACKAGING_INSTALL_PREFIX /usr/lib/q7agent)
set(CPACK_PRE_BUILD_SCRIPTS ${CMAKE_CURRENT_LIST_DIR}/stage.cmake)
# What stage.cmake reads: the configuration templates, and where to write the conffiles list.
set(CPACK_Q7_SOURCE_DIR ${PROJECT_SOURCE_DIR})
set(CPACK_Q7_CONFFILES ${CMAKE_BINARY_DIR}/deb/conffiles)
set(CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA
  ${CPACK_Q7_CONFFILES}
  ${CMAKE_CURRENT_LIST_DIR}/postinst
  ${CMAKE_CURRENT_LIST_DIR}/prerm
  ${CMAKE_CURRENT_LIST_DIR}/postrm)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)

include(CPack)
