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

# The Debian package (scripts/package): the install above under
# CMAKE_INSTALL_PREFIX (configure with /usr for a package), the system user
# made at installation, the databases never touched by removal or purge.
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME cvdbserver)
set(CPACK_PACKAGE_VERSION "${PROJECT_VERSION}")
set(CPACK_PACKAGE_CONTACT "Corvina maintainers <maintainers@corvina.invalid>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "Corvina database server and its command-line client")
set(CPACK_PACKAGING_INSTALL_PREFIX "${CMAKE_INSTALL_PREFIX}")
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION database)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_DEPENDS "adduser")
set(CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA
    "${PROJECT_SOURCE_DIR}/packaging/debian/postinst"
    "${PROJECT_SOURCE_DIR}/packaging/debian/prerm"
    "${PROJECT_SOURCE_DIR}/packaging/debian/postrm")
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
set(CPACK_OUTPUT_FILE_PREFIX "${PROJECT_BINARY_DIR}/package")
include(CPack)
