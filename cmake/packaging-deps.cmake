# Read by cpack (CPACK_PROJECT_CONFIG_FILE): the dependencies of libryacl1
# as dpkg-shlibdeps computes them from the built library, the versions of
# libc6 and the C++ runtime it needs included.  RYACL_BUILT_LIBRARY names it,
# RYACL_DEB_WORK a directory of the build to work in.
find_program(_ryacl_shlibdeps dpkg-shlibdeps)
if(_ryacl_shlibdeps AND EXISTS "${RYACL_BUILT_LIBRARY}")
  # dpkg-shlibdeps wants a source package around it; a minimal one will do.
  set(_dir "${RYACL_DEB_WORK}/shlibdeps")
  file(MAKE_DIRECTORY "${_dir}/debian")
  file(WRITE "${_dir}/debian/control" "Source: ryacl\n\nPackage: libryacl1\nArchitecture: any\n")
  execute_process(COMMAND ${_ryacl_shlibdeps} -O "${RYACL_BUILT_LIBRARY}"
    WORKING_DIRECTORY "${_dir}" RESULT_VARIABLE _rc OUTPUT_VARIABLE _out ERROR_VARIABLE _err)
  if(_rc EQUAL 0 AND _out MATCHES "shlibs:Depends=([^\n]*)")
    set(CPACK_DEBIAN_LIBS_PACKAGE_DEPENDS "${CMAKE_MATCH_1}")
  else()
    message(WARNING "dpkg-shlibdeps ${RYACL_BUILT_LIBRARY} failed (${_rc}): ${_err}")
  endif()
  file(REMOVE_RECURSE "${_dir}")
endif()
