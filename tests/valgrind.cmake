# A representative subset under valgrind memcheck (label "valgrind"), in
# builds without sanitizers: the fuzz replays over their corpora and the
# tests of parsing, trees, buffers, editing, listing, evaluation, reading
# and the allocation-failure sweeps.  Any
# error or any block definitely or indirectly lost fails the test.  The
# identity handler registry lives for the process by design, so "possibly
# lost" is not counted.  Tests that install seccomp filters or kill
# children are left out: valgrind's own system calls would meet the filters.
find_program(VALGRIND valgrind)
if(NOT VALGRIND OR RYACL_SANITIZE)
  return()
endif()
set(_vg ${VALGRIND} -q --error-exitcode=99 --leak-check=full --errors-for-leak-kinds=definite,indirect
        --show-leak-kinds=definite,indirect)
foreach(t test_acl_parse test_acl_tree test_acl_buffer test_acl_edit test_acl_list test_acl_eval test_acl_check
          test_acl_read test_alloc_failures)
  if(TARGET ${t})
    add_test(NAME valgrind_${t} COMMAND ${_vg} $<TARGET_FILE:${t}>)
    set_tests_properties(valgrind_${t} PROPERTIES LABELS "valgrind" TIMEOUT 1200)
  endif()
endforeach()
# The checker with every trace point on and the entries printed: no trace
# point may read or record a byte nobody wrote (an output area recorded
# before it was filled did).
if(TARGET ryaclfck)
  add_test(NAME valgrind_ryaclfck_trace_all
           COMMAND ${_vg} $<TARGET_FILE:ryaclfck> -v -f ${CMAKE_SOURCE_DIR}/examples/service.acl)
  set_tests_properties(valgrind_ryaclfck_trace_all PROPERTIES LABELS "valgrind" TIMEOUT 600
    ENVIRONMENT "RYACL_TRACE=all=8;RYACL_TRACE_FILE=${CMAKE_CURRENT_BINARY_DIR}/valgrind_trace.log")
endif()
file(GLOB _vg_fuzz CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/fuzz/fuzz_*.cpp)
foreach(src ${_vg_fuzz})
  get_filename_component(name ${src} NAME_WE)
  if(EXISTS ${CMAKE_SOURCE_DIR}/fuzz/CMakeLists.txt)
    add_test(NAME valgrind_${name} COMMAND ${_vg} $<TARGET_FILE:replay_${name}> ${CMAKE_SOURCE_DIR}/fuzz/corpus/${name})
    set_tests_properties(valgrind_${name} PROPERTIES LABELS "valgrind" TIMEOUT 1200)
  endif()
endforeach()
