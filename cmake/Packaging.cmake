# The Debian package: `cpack` in a build directory makes ekora_<version>_<arch>.deb holding
# the daemon, its command-line tools, the systemd units and the manual pages. Only the targets
# that call install() end up in it; libraries and tests do not.

install(FILES ${PROJECT_SOURCE_DIR}/man/ekd.8 DESTINATION ${CMAKE_INSTALL_MANDIR}/man8)
install(FILES ${PROJECT_SOURCE_DIR}/man/ekctl.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)

set(EKORA_PACKAGE_MAINTAINER "Ekora developers <ekora@corvane.com>"
    CACHE STRING "Maintainer field of the Debian package")

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
