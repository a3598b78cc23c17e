# What "cmake --install" puts where. The daemon finds its plug-in and its messages relative to itself,
# so the tree may be installed anywhere; orvd installs itself with its manual page.
install(TARGETS cfg slapi back-config LIBRARY DESTINATION lib)
install(TARGETS orvcfg RUNTIME DESTINATION bin)
install(FILES "${CMAKE_BINARY_DIR}/share/orv/orvd.cat" DESTINATION share/orv)
install(FILES docs/man/orvcfg.1 DESTINATION share/man/man1)
install(FILES README.md CHANGELOG.md LICENSE docs/configuration.md DESTINATION share/doc/orv)
