# The process tests of `ryacl explain`, `ryacl diff` and `ryacl edit` run the
# built command: give them its path and make them wait for it.  Deferred to
# the end of the top directory, where the command's target exists.
function(_ryacl_wire_process_tests)
  foreach(t test_ryacl_explain test_ryacl_diff test_ryacl_edit)
    if(TARGET ${t} AND TARGET ryacl_cmd)
      add_dependencies(${t} ryacl_cmd ryaclfck)
      target_compile_definitions(${t} PRIVATE RYACL_PATH="$<TARGET_FILE:ryacl_cmd>")
    endif()
  endforeach()
endfunction()
cmake_language(DEFER DIRECTORY ${CMAKE_SOURCE_DIR} CALL _ryacl_wire_process_tests)
