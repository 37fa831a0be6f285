# Debian packages, one per install component, built with CMake's CPack:
#   cmake --build build && (cd build && cpack -G DEB)
# makes libryacl1 (the shared library and the message catalog it reads),
# libryacl-dev (headers, the .so link, the static library, pkg-config and
# CMake files, section 3 pages) and ryacl (the commands, sections 1 and 5).
# tools/check-deb builds, inspects, lints and installs them.

set(RYACL_MAINTAINER "ryacl developers <ryacl-devel@example.org>" CACHE STRING
  "Maintainer of the Debian packages (name <address>)")

# ---- What every package carries ------------------------------------------------
# A copyright file and a changelog in /usr/share/doc/<package>; the changelog
# compressed, as the manual pages are (man/CMakeLists.txt).
configure_file(${CMAKE_CURRENT_LIST_DIR}/debian/changelog.in ${CMAKE_BINARY_DIR}/debian/changelog @ONLY)
add_custom_command(OUTPUT ${CMAKE_BINARY_DIR}/debian/changelog.gz
  COMMAND sh -c "gzip -9nc \"$0\" > \"$1\"" ${CMAKE_BINARY_DIR}/debian/changelog
          ${CMAKE_BINARY_DIR}/debian/changelog.gz
  DEPENDS ${CMAKE_BINARY_DIR}/debian/changelog VERBATIM)
add_custom_target(ryacl_changelog ALL DEPENDS ${CMAKE_BINARY_DIR}/debian/changelog.gz)

set(_ryacl_components libs dev tools)
set(_ryacl_packages libryacl1 libryacl-dev ryacl)
foreach(component package IN ZIP_LISTS _ryacl_components _ryacl_packages)
  install(FILES ${CMAKE_CURRENT_LIST_DIR}/debian/copyright ${CMAKE_BINARY_DIR}/debian/changelog.gz
    DESTINATION ${CMAKE_INSTALL_DATADIR}/doc/${package} COMPONENT ${component})
endforeach()

# Guides for programmers using the library, beside its manual page.
install(FILES
  ${CMAKE_SOURCE_DIR}/docs/getting-started.md
  ${CMAKE_SOURCE_DIR}/docs/api.md
  ${CMAKE_SOURCE_DIR}/docs/l10n.md
  ${CMAKE_SOURCE_DIR}/docs/tracing.md
  DESTINATION ${CMAKE_INSTALL_DATADIR}/doc/libryacl-dev
  COMPONENT dev
  OPTIONAL)

# ---- The packages --------------------------------------------------------------
set(CPACK_PACKAGE_NAME ryacl)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_VENDOR "ryacl developers")
set(CPACK_PACKAGE_CONTACT "${RYACL_MAINTAINER}")
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL libs dev tools)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
# Installed under /usr whatever the build's own prefix; every path inside
# the installation is relative (the .pc file, the CMake package), so the
# packages work from there as from a staging root.
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
# Shipped binaries carry no debug information.
set(CPACK_STRIP_FILES ON)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
find_program(RYACL_DPKG_SHLIBDEPS dpkg-shlibdeps)

# libryacl1.  Its control files are written here rather than by CPack, which
# would run ldconfig from maintainer scripts: an ldconfig trigger does that
# job once per dpkg run, and a shlibs file tells packages linking
# libryacl.so.1 what to depend on.
set(CPACK_DEBIAN_LIBS_PACKAGE_NAME libryacl1)
set(CPACK_DEBIAN_LIBS_PACKAGE_SECTION libs)
set(CPACK_COMPONENT_LIBS_DESCRIPTION "ACL library: compiled ACLs, editing and permission evaluation
libryacl reads access control list files into compiled ACLs (using and
keeping their cache files), edits and lists compiled ACLs and evaluates
what they grant to a client. Its messages come from the catalog
ryseclib.cat in this package.")
set(CPACK_DEBIAN_LIBS_PACKAGE_SHLIBDEPS OFF)
file(WRITE ${CMAKE_BINARY_DIR}/debian/libs/shlibs "libryacl 1 libryacl1 (>= ${PROJECT_VERSION})\n")
file(WRITE ${CMAKE_BINARY_DIR}/debian/libs/triggers "activate-noawait ldconfig\n")
set(CPACK_DEBIAN_LIBS_PACKAGE_CONTROL_EXTRA
  ${CMAKE_BINARY_DIR}/debian/libs/shlibs ${CMAKE_BINARY_DIR}/debian/libs/triggers)
# Its dependencies, computed from the built library when cpack runs
# (cmake/packaging-deps.cmake); without dpkg-dev, what it links.
set(CPACK_DEBIAN_LIBS_PACKAGE_DEPENDS "libc6, libgcc-s1, libstdc++6")

# libryacl-dev: exactly this version of the library.
set(CPACK_DEBIAN_DEV_PACKAGE_NAME libryacl-dev)
set(CPACK_DEBIAN_DEV_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEV_PACKAGE_DEPENDS "libryacl1 (= ${PROJECT_VERSION})")
set(CPACK_COMPONENT_DEV_DESCRIPTION "ACL library: development files
Headers, the static library, pkg-config and CMake package files and the
manual page ryacl(3) for building programs that use libryacl: read, edit
and list access control lists and evaluate what they grant.")

# ryacl: the commands.  They read the message catalog of libryacl1.
set(CPACK_DEBIAN_TOOLS_PACKAGE_NAME ryacl)
set(CPACK_DEBIAN_TOOLS_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_TOOLS_PACKAGE_DEPENDS "libryacl1 (= ${PROJECT_VERSION})")
if(RYACL_DPKG_SHLIBDEPS)
  set(CPACK_DEBIAN_TOOLS_PACKAGE_SHLIBDEPS ON)
  # A command that links libryacl.so.1 finds it in libryacl1, not among the
  # system's libraries: the dependency above covers it.
  set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS_PRIVATE_DIRS ${CMAKE_BINARY_DIR}/lib)
else()
  set(CPACK_DEBIAN_TOOLS_PACKAGE_DEPENDS "libryacl1 (= ${PROJECT_VERSION}), libc6, libgcc-s1, libstdc++6")
endif()
set(CPACK_COMPONENT_TOOLS_DESCRIPTION "ACL file checker and administration commands
ryaclfck checks access control list files before they are put to use and
caches their compiled form; ryacl queries, explains, compares and edits
them. With the manual pages of the commands and of the ACL file format.")

set(CPACK_PROJECT_CONFIG_FILE ${CMAKE_BINARY_DIR}/debian/cpack-config.cmake)
file(GENERATE OUTPUT ${CPACK_PROJECT_CONFIG_FILE} CONTENT
  "set(RYACL_BUILT_LIBRARY \"$<TARGET_FILE:ryacl>\")\nset(RYACL_DEB_WORK \"${CMAKE_BINARY_DIR}/debian\")\ninclude(\"${CMAKE_CURRENT_LIST_DIR}/packaging-deps.cmake\")\n")
if(NOT CPACK_GENERATOR)
  set(CPACK_GENERATOR DEB)
endif()
include(CPack)

# ---- Checks -------------------------------------------------------------------
# The package check builds the packages, lints them, installs them into a
# scratch root and builds the example client there; it leaves this machine
# as it was.  A sanitizer build is not a package anyone ships.
find_program(RYACL_DPKG_DEB dpkg-deb)
if(RYACL_TESTS AND RYACL_DPKG_DEB AND NOT RYACL_SANITIZE)
  add_test(NAME package_deb COMMAND ${CMAKE_SOURCE_DIR}/tools/check-deb ${CMAKE_BINARY_DIR})
  set_tests_properties(package_deb PROPERTIES TIMEOUT 300 RUN_SERIAL ON)
endif()

# docs/api.md ships in the package: it must be what tools/apidoc makes of
# the headers now.
find_program(RYACL_PYTHON3 python3)
if(RYACL_TESTS AND RYACL_PYTHON3)
  add_test(NAME api_reference_current COMMAND ${RYACL_PYTHON3} ${CMAKE_SOURCE_DIR}/tools/apidoc --check)
endif()
