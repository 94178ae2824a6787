# `cpack -G DEB` in a build tree configured with -DCMAKE_INSTALL_PREFIX=/usr makes three
# packages: tavixd (daemon, tool, units, search provider, man pages), libtavix0 (the shared
# library) and libtavix-dev (headers, pkg-config file, CMake package).
set(TAVIX_PACKAGE_MAINTAINER "tavixd maintainers <maintainers@users.noreply.c-seed-c678cd0e.example>"
  CACHE STRING "Maintainer field of the Debian packages")

set(CPACK_PACKAGE_NAME tavixd)
set(CPACK_PACKAGE_VENDOR "the tavixd authors")
set(CPACK_PACKAGE_CONTACT "${TAVIX_PACKAGE_MAINTAINER}")
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGING_INSTALL_PREFIX ${CMAKE_INSTALL_PREFIX})  # the units name paths under it
set(CPACK_STRIP_FILES ON)
set(CPACK_COMPONENTS_ALL tavixd libtavix0 libtavix-dev)

set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION misc)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_ENABLE_COMPONENT_DEPENDS ON)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
# Our own libtavix is in the package set; dpkg-shlibdeps finds it there.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${CMAKE_BINARY_DIR}/lib)

set(CPACK_DEBIAN_TAVIXD_PACKAGE_NAME tavixd)
set(CPACK_DEBIAN_TAVIXD_PACKAGE_SECTION net)
set(CPACK_DEBIAN_TAVIXD_PACKAGE_RECOMMENDS "xdg-utils")
set(CPACK_COMPONENT_TAVIXD_DEPENDS libtavix0)
set(CPACK_COMPONENT_TAVIXD_DESCRIPTION
  "device-side search and suggestion daemon
tavixd answers the search-as-you-type, zero-keyword, card, look-up and flight
queries of local applications, caches their replies, and gathers and uploads
their engagement feedback. It runs as a systemd user service started by its
socket. The package also holds tavix_tool, its command-line client, and
tavix-search-provider, which offers its results to the desktop's search.")

set(CPACK_DEBIAN_LIBTAVIX0_PACKAGE_NAME libtavix0)
set(CPACK_DEBIAN_LIBTAVIX0_PACKAGE_SECTION libs)
# The library's shlibs file, and the loader cache refreshed by trigger.
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS_POLICY ">=")
set(CPACK_DEBIAN_LIBTAVIX0_PACKAGE_CONTROL_EXTRA ${CMAKE_CURRENT_LIST_DIR}/debian/triggers)
set(CPACK_COMPONENT_LIBTAVIX0_DESCRIPTION
  "client library of the tavixd search daemon
libtavix speaks the IPC protocol of tavixd, the device-side search and
suggestion daemon, over its Unix socket. This package holds the shared
library.")

set(CPACK_DEBIAN_LIBTAVIX-DEV_PACKAGE_NAME libtavix-dev)
set(CPACK_DEBIAN_LIBTAVIX-DEV_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_LIBTAVIX-DEV_PACKAGE_DEPENDS "libprotobuf-dev")
set(CPACK_COMPONENT_LIBTAVIX-DEV_DEPENDS libtavix0)
set(CPACK_COMPONENT_LIBTAVIX-DEV_DESCRIPTION
  "client library of the tavixd search daemon (development files)
libtavix speaks the IPC protocol of tavixd, the device-side search and
suggestion daemon, over its Unix socket. This package holds the headers,
the pkg-config file and the CMake package.")

include(CPack)
