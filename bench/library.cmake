# The library's benchmarks (evaluation, edits of a large sub-ACL, reading an
# ACL file); included by bench/CMakeLists.txt.
find_package(benchmark REQUIRED)
if(NOT TARGET bench_library)
  add_executable(bench_library ${CMAKE_CURRENT_LIST_DIR}/bench_library.cpp)
  target_compile_options(bench_library PRIVATE ${RYACL_WARNINGS})
  # Static: the baseline walk uses the utility layer's comparison, which the
  # shared library does not export.
  target_link_libraries(bench_library PRIVATE ryacl_static benchmark::benchmark)
  target_include_directories(bench_library PRIVATE ${RYACL_LIB_DIR})
endif()
