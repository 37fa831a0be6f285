# `ryacl check` against `ryaclfck -c`, whole processes; included by
# bench/CMakeLists.txt.
add_executable(bench_ryacl_check ${CMAKE_CURRENT_LIST_DIR}/bench_ryacl_check.cpp)
target_compile_options(bench_ryacl_check PRIVATE ${RYACL_WARNINGS})
target_compile_definitions(bench_ryacl_check PRIVATE
  RYACLFCK_PATH="$<TARGET_FILE:ryaclfck>" RYACL_CMD_PATH="$<TARGET_FILE:ryacl_cmd>")
target_link_libraries(bench_ryacl_check PRIVATE ryacl_acl_gen)
add_dependencies(bench_ryacl_check ryaclfck ryacl_cmd)
