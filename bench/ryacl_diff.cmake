# `ryacl diff` at scale against the checker, both as whole processes.
if(TARGET ryacl_cmd)
  add_executable(bench_ryacl_diff ${CMAKE_CURRENT_LIST_DIR}/bench_ryacl_diff.cpp)
  target_compile_options(bench_ryacl_diff PRIVATE ${RYACL_WARNINGS})
  target_compile_definitions(bench_ryacl_diff PRIVATE RYACLFCK_PATH="$<TARGET_FILE:ryaclfck>"
                                                      RYACL_PATH="$<TARGET_FILE:ryacl_cmd>")
  target_link_libraries(bench_ryacl_diff PRIVATE ryacl_acl_gen benchmark::benchmark)
  add_dependencies(bench_ryacl_diff ryaclfck ryacl_cmd)
endif()
