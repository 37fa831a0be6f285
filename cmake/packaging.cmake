# Debian package of the whole installation, built with CMake's own CPack:
#   cmake --build build && (cd build && cpack -G DEB)
# tools/check-deb builds, inspects and tries the package.

# Guides for users of the installed library, beside the manual pages.
install(FILES
  ${CMAKE_SOURCE_DIR}/docs/getting-started.md
  ${CMAKE_SOURCE_DIR}/docs/api.md
  ${CMAKE_SOURCE_DIR}/docs/l10n.md
  ${CMAKE_SOURCE_DIR}/docs/tracing.md
  DESTINATION ${CMAKE_INSTALL_DOCDIR}
  OPTIONAL)

set(CPACK_PACKAGE_NAME ryacl)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_VENDOR "ryacl developers")
set(CPACK_PACKAGE_CONTACT "ryacl developers <dev@ryacl.local>")
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "ACL file checker, query command and ACL library")
# The extended description; CPack puts the summary above it.
set(CPACK_DEBIAN_PACKAGE_DESCRIPTION "ryaclfck checks access control list files for services before they are
put to use, and caches their compiled form. ryacl checks, queries,
lists, compares and edits them. libryacl reads ACL files into compiled ACLs, edits
and lists them and evaluates permissions. Includes the headers, the
static library, pkg-config and CMake files, the message catalog and the
manual pages.")
set(CPACK_DEBIAN_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_PACKAGE_PRIORITY optional)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
# Installed under /usr whatever the build's own prefix; every path inside
# the installation is relative (the .pc file, the CMake package), so the package works from there as from a staging root.
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
# Shipped binaries carry no debug information.
set(CPACK_STRIP_FILES ON)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
# An shlibs file for packages that link libryacl.so.1, and ldconfig runs
# in postinst and postrm.
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS_POLICY ">=")
find_program(RYACL_DPKG_SHLIBDEPS dpkg-shlibdeps)
if(RYACL_DPKG_SHLIBDEPS)
  set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
else()
  # Without dpkg-dev the dependencies cannot be computed; these are what the
  # commands and the library link.
  set(CPACK_DEBIAN_PACKAGE_DEPENDS "libc6, libgcc-s1, libstdc++6")
endif()
if(NOT CPACK_GENERATOR)
  set(CPACK_GENERATOR DEB)
endif()
include(CPack)

# The package check builds a package and unpacks it into a scratch root;
# it installs nothing on this machine.  A sanitizer build is not a
# package anyone ships.
find_program(RYACL_DPKG_DEB dpkg-deb)
if(RYACL_TESTS AND RYACL_DPKG_DEB AND NOT RYACL_SANITIZE)
  add_test(NAME package_deb COMMAND ${CMAKE_SOURCE_DIR}/tools/check-deb ${CMAKE_BINARY_DIR})
  set_tests_properties(package_deb PROPERTIES TIMEOUT 120 RUN_SERIAL ON)
endif()

# docs/api.md ships in the package: it must be what tools/apidoc makes of
# the headers now.
find_program(RYACL_PYTHON3 python3)
if(RYACL_TESTS AND RYACL_PYTHON3)
  add_test(NAME api_reference_current COMMAND ${RYACL_PYTHON3} ${CMAKE_SOURCE_DIR}/tools/apidoc --check)
endif()
