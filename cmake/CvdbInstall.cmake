# What `cmake --install` puts where: the two programs, the systemd unit
# (its ExecStart and documentation paths follow the install prefix), the
# documentation and an example config.json.

include(GNUInstallDirs)

set(CVDB_DOC_DIR "${CMAKE_INSTALL_DATAROOTDIR}/doc/cvdbserver")

install(TARGETS cvdbserver cvdb RUNTIME DESTINATION "${CMAKE_INSTALL_BINDIR}")

set_property(DIRECTORY APPEND PROPERTY CMAKE_CONFIGURE_DEPENDS "${PROJECT_SOURCE_DIR}/packaging/cvdbserver.service")
file(READ "${PROJECT_SOURCE_DIR}/packaging/cvdbserver.service" cvdb_unit)
string(REPLACE "/usr/local/bin/" "${CMAKE_INSTALL_FULL_BINDIR}/" cvdb_unit "${cvdb_unit}")
string(REPLACE "/usr/local/share/doc/cvdbserver/" "${CMAKE_INSTALL_PREFIX}/${CVDB_DOC_DIR}/" cvdb_unit "${cvdb_unit}")
file(WRITE "${PROJECT_BINARY_DIR}/packaging/cvdbserver.service" "${cvdb_unit}")
# systemd reads units from <prefix>/lib/systemd/system for /usr and /usr/local.
install(FILES "${PROJECT_BINARY_DIR}/packaging/cvdbserver.service" DESTINATION lib/systemd/system)

file(GLOB cvdb_docs "${PROJECT_SOURCE_DIR}/docs/*.md")
install(FILES README.md ${cvdb_docs} DESTINATION "${CVDB_DOC_DIR}")
install(FILES packaging/config.example.json DESTINATION "${CVDB_DOC_DIR}/examples")
