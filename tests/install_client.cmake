# A real client of the installed package: install into a temporary prefix,
# build examples/client once through find_package(ryacl) and once through
# pkg-config, run both on an ACL file and compare their output with what the
# file grants.
#
# Included by tests/CMakeLists.txt, this file registers the test; run with
# cmake -P (as the test does), it is the test.
if(NOT CMAKE_SCRIPT_MODE_FILE)
  if(NOT RYACL_SANITIZE)  # an uninstrumented client cannot load an instrumented library
    add_test(NAME install_client
      COMMAND ${CMAKE_COMMAND} -DBUILD=${CMAKE_BINARY_DIR} -DSRC=${CMAKE_SOURCE_DIR}
              -DCC=${CMAKE_C_COMPILER} -P ${CMAKE_CURRENT_LIST_FILE})
    set_tests_properties(install_client PROPERTIES RUN_SERIAL TRUE)
  endif()
  return()
endif()

function(run)
  execute_process(COMMAND ${ARGN} RESULT_VARIABLE rc OUTPUT_VARIABLE out ERROR_VARIABLE err)
  if(NOT rc EQUAL 0)
    message(FATAL_ERROR "failed (${rc}): ${ARGN}\n${out}\n${err}")
  endif()
  set(run_out "${out}" PARENT_SCOPE)
endfunction()

set(tmp ${BUILD}/install_client)
file(REMOVE_RECURSE ${tmp})
file(MAKE_DIRECTORY ${tmp})
set(prefix ${tmp}/prefix)
run(${CMAKE_COMMAND} --install ${BUILD} --prefix ${prefix})

# find_package(ryacl)
run(${CMAKE_COMMAND} -S ${SRC}/examples/client -B ${tmp}/cmake-build
    -DCMAKE_PREFIX_PATH=${prefix} -DCMAKE_C_COMPILER=${CC} -DCMAKE_BUILD_TYPE=Release)
run(${CMAKE_COMMAND} --build ${tmp}/cmake-build)

# pkg-config
file(GLOB_RECURSE pcfile ${prefix}/ryacl.pc)
if(NOT pcfile)
  message(FATAL_ERROR "no ryacl.pc under ${prefix}")
endif()
get_filename_component(pcdir ${pcfile} DIRECTORY)
get_filename_component(libdir ${pcdir} DIRECTORY)
set(ENV{PKG_CONFIG_PATH} ${pcdir})
run(pkg-config --cflags --libs ryacl)
string(STRIP "${run_out}" pcflags)
separate_arguments(pcflags UNIX_COMMAND "${pcflags}")
run(${CC} -std=c99 -Wall -Wextra -Wpedantic -Werror ${SRC}/examples/client/client.c
    -o ${tmp}/client-pkgconfig ${pcflags})

# The ACL file, older than any cache written now, so the second read can
# take the cache.
set(aclfile ${tmp}/service.acl)
file(WRITE ${aclfile} "n r\no rl\nu unix bob@node1 rw\ne unix admins rwcx\ng staff rlq\ng auditors rle\n")
run(touch -d "2000-01-01 00:00:00" ${aclfile})

set(expected "compiled: [0-9]+ bytes, from text, cache written
again: [0-9]+ bytes, from cache
user: 0x3 rw
expanded: 0xf rwcx
groups: 0xe1 rqle
anyother: 0x41 rl
")
set(ENV{LD_LIBRARY_PATH} ${libdir})
foreach(client ${tmp}/cmake-build/ryacl_client ${tmp}/client-pkgconfig)
  file(REMOVE ${aclfile}.cacl)
  run(${client} ${aclfile} unix bob@node1 admins/alice staff auditors nobody)
  if(NOT run_out MATCHES "^${expected}$")
    message(FATAL_ERROR "${client} printed:\n${run_out}")
  endif()
  message(STATUS "${client}:\n${run_out}")
endforeach()
file(REMOVE_RECURSE ${tmp})
