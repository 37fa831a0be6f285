# `ryacl diff` at scale against the checker, both as whole processes.
if(TARGET ryacl_cmd)
  add_executable(bench_cmd ${CMAKE_CURRENT_LIST_DIR}/bench_cmd.cpp)
  target_compile_options(bench_cmd PRIVATE ${RYACL_WARNINGS})
  target_compile_definitions(bench_cmd PRIVATE RYACLFCK_PATH="$<TARGET_FILE:ryaclfck>"
                                               RYACL_PATH="$<TARGET_FILE:ryacl_cmd>")
  target_link_libraries(bench_cmd PRIVATE ryacl_acl_gen benchmark::benchmark)
  add_dependencies(bench_cmd ryaclfck ryacl_cmd)
endif()
