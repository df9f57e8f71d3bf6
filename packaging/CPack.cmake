# Installing the browser front end, and the Debian package.
#
# Included at the end of the top-level CMakeLists.txt, after every target's
# own install() rules. `cmake --install <build>` then puts everything at the
# paths the programs look for:
#
#   <prefix>/sbin/zark-webapid                  host (systemd unit beside the
#   <prefix>/lib/systemd/system/zark-webapid.service   others)
#   <prefix>/<libdir>/zark/lib*.so              platform libraries (RPATH)
#   <prefix>/<libdir>/zark/modules/ZARK.Core.PortForwarding.so
#   <prefix>/share/zark/www/                    browser front end (www/dist)
#   <prefix>/bin/zark-probed                    probe service
#   <prefix>/<libdir>/zark/modules/ZARK.Core.PortForwarding.Status.so
#                                               status module (the keeper)
#   /usr/zark/bin/zarkportforward               tool the module runs
#   /usr/zark/etc.defaults/services.d/*.sc      firewall service definitions
#   /usr/zark/etc.defaults/firewall_service_mapping_table
#   /etc.defaults/portforward/routerdb/         shipped router database
#   <sysconfdir>/zark/                          folder of the accounts file
#
# The host's default folders and the libraries' RPATH are fixed when the
# build is configured, from CMAKE_INSTALL_PREFIX; configure with
# -DCMAKE_INSTALL_PREFIX=/usr for an installation or a package.
#
#   cmake -S . -B build -DCMAKE_INSTALL_PREFIX=/usr
#   bash www/scripts/check.sh            # builds www/dist
#   cmake --build build
#   cmake --install build                # or: cd build && cpack -G DEB

# ---- the browser front end -------------------------------------------------

option(ZARK_INSTALL_WWW
       "Install the built browser front end (www/dist) with the host" ON)
set(ZARK_WWW_DIST_DIR ${CMAKE_SOURCE_DIR}/www/dist
    CACHE PATH "The built browser front end (npm run build in www/)")

if(ZARK_INSTALL_WWW)
  # www/dist is built by npm, not by CMake: check at install time that it is
  # there, so that an installation never ends up without its front end.
  install(CODE "
    if(NOT EXISTS \"${ZARK_WWW_DIST_DIR}/index.html\")
      message(FATAL_ERROR
        \"${ZARK_WWW_DIST_DIR}/index.html is missing: build the front end \"
        \"first (bash www/scripts/check.sh, or npm ci && npm run build in \"
        \"www/), or configure with -DZARK_INSTALL_WWW=OFF\")
    endif()")
  # The host's www folder (ZARK_WEBAPID_WWW_DIR, from host/CMakeLists.txt)
  # is absolute; installing into it relative to the prefix keeps DESTDIR
  # and CPack staging working.
  file(RELATIVE_PATH ZARK_WWW_INSTALL_DIR ${CMAKE_INSTALL_PREFIX}
       ${ZARK_WEBAPID_WWW_DIR})
  if(ZARK_WWW_INSTALL_DIR MATCHES "^\\.\\.")
    set(ZARK_WWW_INSTALL_DIR ${ZARK_WEBAPID_WWW_DIR})
  endif()
  install(DIRECTORY ${ZARK_WWW_DIST_DIR}/
          DESTINATION ${ZARK_WWW_INSTALL_DIR}
          DIRECTORY_PERMISSIONS OWNER_READ OWNER_WRITE OWNER_EXECUTE GROUP_READ
                                GROUP_EXECUTE WORLD_READ WORLD_EXECUTE
          FILE_PERMISSIONS OWNER_READ OWNER_WRITE GROUP_READ WORLD_READ)
endif()

# ---- the folder of the accounts file ---------------------------------------

# `zark-webapid passwd` writes the accounts file atomically beside itself,
# so its folder must exist; it holds password hashes, hence root only.
get_filename_component(ZARK_ACCOUNTS_INSTALL_DIR ${ZARK_WEBAPID_ACCOUNTS_FILE}
                       DIRECTORY)
install(DIRECTORY DESTINATION ${ZARK_ACCOUNTS_INSTALL_DIR}
        DIRECTORY_PERMISSIONS OWNER_READ OWNER_WRITE OWNER_EXECUTE)

# ---- the Debian package ----------------------------------------------------

set(ZARK_PACKAGE_CONTACT "ZARK port-forwarding maintainers <root@localhost>"
    CACHE STRING "Maintainer field of the Debian package")

set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME zark-portforwarding)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_CONTACT ${ZARK_PACKAGE_CONTACT})
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY
    "port forwarding on the home router, administered from a browser")
set(CPACK_PACKAGE_DESCRIPTION
    "The port-forwarding module of the server's web administration service, \
its web API host zark-webapid with the browser front end, the platform \
libraries, the status module whose keeper renews the router's mappings \
inside the host, the zarkportforward tool, the firewall service \
definitions and the router database.")
# The package holds what `cmake --install` puts under the configured prefix
# and the fixed absolute paths; both are staged as they are.
set(CPACK_PACKAGING_INSTALL_PREFIX ${CMAKE_INSTALL_PREFIX})
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION net)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
# The shared libraries the programs need (objdump -p: NEEDED) in Debian 12,
# with the versions dpkg-shlibdeps gives for this build.
# libcpp-httplib0.11 brings OpenSSL, zlib and brotli itself.
set(CPACK_DEBIAN_PACKAGE_DEPENDS
    "libc6 (>= 2.34), libstdc++6 (>= 12), libgcc-s1 (>= 3.0), \
libjsoncpp25 (>= 1.9.5), libminiupnpc17 (>= 2.0.20171212), \
libnatpmp1 (>= 20150609), libcpp-httplib0.11 (>= 0.11.4+ds), \
libcrypt1 (>= 1:4.1.0), libexpat1 (>= 2.5.0), libc-ares2 (>= 1.18.1), \
libarchive13 (>= 3.6.2)")
# Debug information stays in the build folder.
set(CPACK_STRIP_FILES TRUE)
set(CPACK_DEBIAN_PACKAGE_RECOMMENDS "systemd")
# Maintainer scripts: the host (and so the keeper, the renewal service) is
# enabled and started after install, stopped and disabled before removal.
set(CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA
    ${CMAKE_CURRENT_LIST_DIR}/debian/postinst
    ${CMAKE_CURRENT_LIST_DIR}/debian/prerm
    ${CMAKE_CURRENT_LIST_DIR}/debian/postrm)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION TRUE)

if(NOT CMAKE_INSTALL_PREFIX STREQUAL "/usr")
  message(STATUS "Debian package: CMAKE_INSTALL_PREFIX is "
                 "${CMAKE_INSTALL_PREFIX}; a package for the system wants "
                 "-DCMAKE_INSTALL_PREFIX=/usr")
endif()

include(CPack)
