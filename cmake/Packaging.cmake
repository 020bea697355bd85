# The Debian package: `cpack` in a build directory makes ekora_<version>_<arch>.deb holding
# the daemon, its command-line tools, the systemd units (the root instance's and the per-user
# ones), the manual pages, the copyright file and the maintainer scripts. Only the targets
# that call install() end up in it; libraries and tests do not.

# Manual pages go in compressed, as Debian's policy wants them; -n keeps the archive free of
# the build's time, so two builds of one tree make the same package.
find_program(EKORA_GZIP gzip REQUIRED)
set(ekora_compressed "")
foreach(page ekd.8 ekctl.1 ek-sandbox-exec.1)
  set(compressed ${PROJECT_BINARY_DIR}/man/${page}.gz)
  add_custom_command(OUTPUT ${compressed}
    COMMAND ${CMAKE_COMMAND} -E make_directory ${PROJECT_BINARY_DIR}/man
    COMMAND ${EKORA_GZIP} -9n -c ${PROJECT_SOURCE_DIR}/man/${page} > ${compressed}
    DEPENDS ${PROJECT_SOURCE_DIR}/man/${page} VERBATIM)
  string(REGEX REPLACE ".*\\." "" section ${page})
  install(FILES ${compressed} DESTINATION ${CMAKE_INSTALL_MANDIR}/man${section})
  list(APPEND ekora_compressed ${compressed})
endforeach()

set(EKORA_PACKAGE_MAINTAINER "Ekora developers <ekora@corvane.com>"
    CACHE STRING "Maintainer field of the Debian package")

configure_file(${PROJECT_SOURCE_DIR}/packaging/changelog.in ${PROJECT_BINARY_DIR}/changelog @ONLY)
add_custom_command(OUTPUT ${PROJECT_BINARY_DIR}/changelog.gz
  COMMAND ${EKORA_GZIP} -9n -c ${PROJECT_BINARY_DIR}/changelog > ${PROJECT_BINARY_DIR}/changelog.gz
  DEPENDS ${PROJECT_BINARY_DIR}/changelog VERBATIM)
add_custom_target(ekora_package_files ALL DEPENDS ${ekora_compressed}
  ${PROJECT_BINARY_DIR}/changelog.gz)
install(FILES ${PROJECT_SOURCE_DIR}/packaging/copyright ${PROJECT_BINARY_DIR}/changelog.gz
  DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/doc/ekora)
install(FILES ${PROJECT_SOURCE_DIR}/packaging/lintian-overrides
  DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/lintian/overrides RENAME ekora)

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME ekora)
set(CPACK_PACKAGE_VENDOR "Corvane")
set(CPACK_PACKAGE_CONTACT "${EKORA_PACKAGE_MAINTAINER}")
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "plug-in registry daemon and its command-line client")
# Wrapped as the control file wants it; a line holding only a dot separates paragraphs.
set(CPACK_PACKAGE_DESCRIPTION
    "ekd keeps the registry of installed plug-ins (application extensions inside
applications, and system plug-ins), answers the questions host processes ask
about them over a local IPC protocol, remembers per-plug-in user choices and
decides which host may discover, launch and use which plug-in.
.
The package holds ekd with the socket-activated systemd units that start it,
the ekctl command-line client and the ek-sandbox-exec launcher.")
# Programs are built with debug information; the package ships them without it.
set(CPACK_STRIP_FILES ON)

set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
# Enable the root socket and every user's socket on installation, disable them on removal.
set(CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA ${PROJECT_SOURCE_DIR}/packaging/postinst
    ${PROJECT_SOURCE_DIR}/packaging/prerm ${PROJECT_SOURCE_DIR}/packaging/postrm)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
set(CPACK_DEBIAN_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_DEBIAN_PACKAGE_MAINTAINER "${EKORA_PACKAGE_MAINTAINER}")
# The units are the supported way to run the daemon, but ekd and ekctl run without systemd.
set(CPACK_DEBIAN_PACKAGE_SUGGESTS systemd)

option(EKORA_PACKAGE_SHLIBDEPS "Compute the package's dependencies with dpkg-shlibdeps" ON)
find_program(EKORA_DPKG_SHLIBDEPS dpkg-shlibdeps)
if(EKORA_PACKAGE_SHLIBDEPS AND EKORA_DPKG_SHLIBDEPS)
  set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
else()
  # What the programs link dynamically, by the names Debian 12 gives those libraries.
  set(CPACK_DEBIAN_PACKAGE_DEPENDS
      "libc6, libstdc++6, libgcc-s1, libcbor0.8, libsystemd0, libexpat1, libsqlite3-0, \
libssl3, libfmt9")
endif()

set(CPACK_SOURCE_GENERATOR TGZ)
set(CPACK_SOURCE_IGNORE_FILES "/\\\\.git/" "/build[^/]*/")

include(CPack)
