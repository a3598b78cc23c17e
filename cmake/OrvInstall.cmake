# What "cmake --install" puts where. The daemon finds its plug-in and its messages relative to itself,
# so the tree may be installed anywhere; orvd installs itself with its manual page.
install(TARGETS cfg slapi back-config LIBRARY DESTINATION lib)
install(TARGETS orvcfg RUNTIME DESTINATION bin)
install(FILES "${CMAKE_BINARY_DIR}/share/orv/orvd.cat" DESTINATION share/orv)
install(FILES docs/man/orvcfg.1 DESTINATION share/man/man1)
install(FILES README.md CHANGELOG.md LICENSE docs/configuration.md DESTINATION share/doc/orv)

# The unit names the daemon by its whole path, which is known when it is installed.
install(CODE "set(ORV_UNIT \"${CMAKE_SOURCE_DIR}/packaging/orvd.service.in\")")
install(CODE [[
  file(READ "${ORV_UNIT}" unit)
  string(REPLACE "@PREFIX@" "${CMAKE_INSTALL_PREFIX}" unit "${unit}")
  set(orv_unit_folder "${CMAKE_INSTALL_PREFIX}/lib/systemd/system")
  message(STATUS "Installing: ${orv_unit_folder}/orvd.service")
  file(MAKE_DIRECTORY "$ENV{DESTDIR}${orv_unit_folder}")
  file(WRITE "$ENV{DESTDIR}${orv_unit_folder}/orvd.service" "${unit}")
]])
install(FILES packaging/orv.sysusers DESTINATION lib/sysusers.d RENAME orv.conf)
