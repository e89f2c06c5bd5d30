# Debian packages, built with `cpack -G DEB` (scripts/package builds them into dist/):
#   libkovacredential6     the shared library and its soname link (component runtime),
#   libkovacredential-dev  headers, the .so link, kovacredential.pc, the CMake package and
#                          libkovacredential(3) (component dev),
#   kovacred               kovacred, its manual page and the bash completion (component tools),
#   kovasim                the loopback simulator and its manual page (component sim), apart so
#                          that kovacred neither installs it nor pulls in what only it needs
#                          (cpp-httplib, zlib).
#
# The library package carries dpkg's ldconfig trigger and a symbols file. CPack checks the
# library's symbols against doc/deb/libkovacredential6.symbols before it builds the packages
# (doc/deb/check-symbols.cmake: a symbol missing fails the build) and afterwards takes out
# the postinst and postrm that call ldconfig (doc/deb/drop-ldconfig-scripts.cmake).
#
# lintian reports no error on them. The warning left, and why:
# - pkg-config-unavailable-for-cross-compilation (libkovacredential-dev): only for packages
#   made from a build whose library folder is not the multiarch one (the test suite's build,
#   prefix /usr/local, installs into lib/). scripts/package configures for /usr, which puts
#   the library and kovacredential.pc under lib/<multiarch triplet>/.
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME libkovacredential)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_CONTACT "libkovacredential developers <kovacredential@example.org>")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_COMPONENTS_ALL runtime dev)
if(KOVA_BUILD_TOOLS)
  list(APPEND CPACK_COMPONENTS_ALL tools sim)
endif()

# The Debian architecture the packages are for: the build machine's, or a cross build's
# (the toolchain files name it as Debian does).
if(CMAKE_CROSSCOMPILING)
  set(KOVA_DEB_ARCHITECTURE ${KOVA_CROSS_ARCH})
else()
  execute_process(COMMAND dpkg --print-architecture OUTPUT_VARIABLE KOVA_DEB_ARCHITECTURE
                  OUTPUT_STRIP_TRAILING_WHITESPACE)
endif()
set(CPACK_DEBIAN_PACKAGE_ARCHITECTURE ${KOVA_DEB_ARCHITECTURE})

# Run-time dependencies come from dpkg-shlibdeps; it finds libkovacredential.so.6, which the
# tools need, in the build tree, and the packages' own dependency on it comes from the
# component dependencies below, pinned to this version.
if(NOT CMAKE_CROSSCOMPILING)
  set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
  set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${PROJECT_BINARY_DIR})
else()
  # dpkg-shlibdeps looks the libraries up in the installed packages of the target
  # architecture, and a cross build has none: these are the dependencies it computes for the
  # native Debian 12 build. Package names and symbol versions are the same on every Debian
  # architecture; kovasim uses cpp-httplib only through its header here.
  set(KOVA_DEB_LIBRARY_DEPENDS "libc6 (>= 2.34), libcurl4 (>= 7.66.0), libgcc-s1 (>= 3.0), \
libjsoncpp25 (>= 1.9.5), libsqlite3-0 (>= 3.6.5), libssl3 (>= 3.0.0), libstdc++6 (>= 12)")
  set(CPACK_DEBIAN_RUNTIME_PACKAGE_DEPENDS ${KOVA_DEB_LIBRARY_DEPENDS})
  set(CPACK_DEBIAN_TOOLS_PACKAGE_DEPENDS ${KOVA_DEB_LIBRARY_DEPENDS})
  set(CPACK_DEBIAN_SIM_PACKAGE_DEPENDS "${KOVA_DEB_LIBRARY_DEPENDS}, zlib1g (>= 1:1.1.4)")
endif()
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS_POLICY ">=")
set(CPACK_DEBIAN_ENABLE_COMPONENT_DEPENDS ON)
set(CPACK_COMPONENT_DEV_DEPENDS runtime)
set(CPACK_COMPONENT_TOOLS_DEPENDS runtime)
set(CPACK_COMPONENT_SIM_DEPENDS runtime)

set(CPACK_DEBIAN_RUNTIME_PACKAGE_NAME libkovacredential6)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_SECTION libs)
# dpkg's ldconfig trigger updates the linker cache (lintian's lacks-ldconfig-trigger); the
# symbols file is the one check-symbols.cmake writes from the checked-in one.
set(CPACK_KOVA_SYMBOLS_TEMPLATE ${PROJECT_SOURCE_DIR}/doc/deb/libkovacredential6.symbols)
set(CPACK_KOVA_SYMBOLS_OUTPUT ${PROJECT_BINARY_DIR}/deb/symbols/symbols)
set(CPACK_DEBIAN_RUNTIME_PACKAGE_CONTROL_EXTRA ${PROJECT_SOURCE_DIR}/doc/deb/triggers
    ${CPACK_KOVA_SYMBOLS_OUTPUT})
set(CPACK_PRE_BUILD_SCRIPTS ${PROJECT_SOURCE_DIR}/doc/deb/check-symbols.cmake)
set(CPACK_POST_BUILD_SCRIPTS ${PROJECT_SOURCE_DIR}/doc/deb/drop-ldconfig-scripts.cmake)
set(CPACK_COMPONENT_RUNTIME_DESCRIPTION
    "credential store and WebAPI requests for server programs
libkovacredential keeps credentials for remote servers in a SQLite
database and calls those servers' WebAPI over HTTP(S) through libcurl,
with retries, encrypted parameters, automatic login, many requests at
once and a relay directory client.
.
This package holds the shared library.")

set(CPACK_DEBIAN_DEV_PACKAGE_NAME libkovacredential-dev)
set(CPACK_DEBIAN_DEV_PACKAGE_SECTION libdevel)
# The public headers include curl, jsoncpp and OpenSSL headers; the CMake package finds them
# (and jsoncpp through pkg-config), and kovacredential.pc names sqlite3 for static links.
set(CPACK_DEBIAN_DEV_PACKAGE_DEPENDS
    "libcurl4-openssl-dev | libcurl-dev, libjsoncpp-dev, libssl-dev, libsqlite3-dev, pkg-config")
set(CPACK_COMPONENT_DEV_DESCRIPTION
    "credential store and WebAPI requests (development files)
libkovacredential keeps credentials for remote servers in a SQLite
database and calls those servers' WebAPI over HTTP(S) through libcurl.
.
This package holds the headers, the pkg-config file, the CMake package
and the manual page libkovacredential(3).")

set(CPACK_DEBIAN_TOOLS_PACKAGE_NAME kovacred)
set(CPACK_DEBIAN_TOOLS_PACKAGE_SECTION utils)
set(CPACK_COMPONENT_TOOLS_DESCRIPTION
    "command-line tool for libkovacredential credentials and WebAPI calls
kovacred stores credentials for remote servers, logs in with them, calls
their WebAPI one by one or many at once, sends single HTTP(S) requests
and finds servers through the relay directory.")

set(CPACK_DEBIAN_SIM_PACKAGE_NAME kovasim)
set(CPACK_DEBIAN_SIM_PACKAGE_SECTION devel)
set(CPACK_COMPONENT_SIM_DESCRIPTION
    "loopback simulator of the servers libkovacredential talks to
kovasim serves a WebAPI (discovery, encryption information, login,
logout and demo APIs) and optionally a relay directory on loopback
HTTP and HTTPS, or one hostile peer, to try programs against.")

# Each package carries the copyright file and changelog Debian asks for; a plain
# `cmake --install` leaves them out.
set(KOVA_DEB_CHANGELOG ${PROJECT_BINARY_DIR}/deb/changelog.gz)
configure_file(doc/changelog.in ${PROJECT_BINARY_DIR}/deb/changelog @ONLY)
find_program(KOVA_GZIP gzip REQUIRED)
add_custom_command(OUTPUT ${KOVA_DEB_CHANGELOG}
  COMMAND ${KOVA_GZIP} -9n -c ${PROJECT_BINARY_DIR}/deb/changelog > ${KOVA_DEB_CHANGELOG}
  DEPENDS ${PROJECT_BINARY_DIR}/deb/changelog)
add_custom_target(kova_deb_changelog ALL DEPENDS ${KOVA_DEB_CHANGELOG})
foreach(component IN LISTS CPACK_COMPONENTS_ALL)
  string(TOUPPER ${component} upper)
  install(FILES doc/copyright ${KOVA_DEB_CHANGELOG}
          DESTINATION ${CMAKE_INSTALL_DATADIR}/doc/${CPACK_DEBIAN_${upper}_PACKAGE_NAME}
          COMPONENT ${component} EXCLUDE_FROM_ALL)
endforeach()

include(CPack)
