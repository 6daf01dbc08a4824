# What an installation holds, and the Debian package made from it (./dev package).
include(GNUInstallDirs)
find_program(GZIP gzip REQUIRED)

install(TARGETS sabled sablectl sable-service)
install(FILES packaging/com.kestrel.sabled.service packaging/com.kestrel.sabled.socket
  DESTINATION lib/systemd/user)
install(FILES packaging/completion/sablectl DESTINATION ${CMAKE_INSTALL_DATADIR}/bash-completion/completions)

# Debian wants its pages and its changelog compressed, and without a time stamp so that a build can be repeated.
install(CODE "
  function(compressed from to)
    get_filename_component(folder \"\${to}\" DIRECTORY)
    file(MAKE_DIRECTORY \"\$ENV{DESTDIR}\${CMAKE_INSTALL_PREFIX}/\${folder}\")
    execute_process(COMMAND ${GZIP} -9 -n -c INPUT_FILE ${PROJECT_SOURCE_DIR}/\${from}
      OUTPUT_FILE \"\$ENV{DESTDIR}\${CMAKE_INSTALL_PREFIX}/\${to}.gz\" COMMAND_ERROR_IS_FATAL ANY)
  endfunction()
  compressed(CHANGELOG.md ${CMAKE_INSTALL_DATADIR}/doc/sabled/changelog)
  foreach(page sabled sablectl sable-service)
    compressed(packaging/man/\${page}.1 ${CMAKE_INSTALL_DATADIR}/man/man1/\${page}.1)
  endforeach()")

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME sabled)
set(CPACK_PACKAGE_CONTACT "sabled developers <sabled@kestrel.invalid>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "search suggestions daemon, its command line and its reference service")
set(CPACK_PACKAGE_DESCRIPTION
"sabled runs in a user's session between the programs that search and a remote
search service. It answers over a local D-Bus socket, keeps what may be kept,
loads images, and brings the programs' feedback to the service.
.
The package holds the daemon, its command line sablectl, the reference search
service sable-service, and units that start the daemon on its first client.")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_INSTALL_CMAKE_PROJECTS "${CMAKE_BINARY_DIR};sabled;ALL;/")
set(CMAKE_SKIP_INSTALL_ALL_DEPENDENCY ON)
set(CPACK_STRIP_FILES ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION utils)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_RECOMMENDS "dbus-user-session, wordnet-base")
set(CPACK_DEBIAN_PACKAGE_SUGGESTS "geoclue-2.0")
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
include(CPack)
