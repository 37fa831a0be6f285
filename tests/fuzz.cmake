# The fuzz targets under CTest (label "fuzz").  Each replays its committed
# seed corpus through the plain driver, in every build with the tests.  With
# RYACL_FUZZ and clang, each also fuzzes for a bounded time, starting from
# that corpus; what it finds new goes to a scratch directory in the build
# tree (crashes too), never into the committed corpus.
if(NOT EXISTS ${CMAKE_SOURCE_DIR}/fuzz/CMakeLists.txt)
  return()
endif()
set(RYACL_FUZZ_SECONDS 60 CACHE STRING "Seconds each fuzz target runs under CTest (RYACL_FUZZ builds)")

file(GLOB _fuzz_sources CONFIGURE_DEPENDS ${CMAKE_SOURCE_DIR}/fuzz/fuzz_*.cpp)
foreach(src ${_fuzz_sources})
  get_filename_component(name ${src} NAME_WE)
  set(corpus ${CMAKE_SOURCE_DIR}/fuzz/corpus/${name})
  add_test(NAME ${name}_replay COMMAND $<TARGET_FILE:replay_${name}> ${corpus})
  set_tests_properties(${name}_replay PROPERTIES LABELS "fuzz")

  if(RYACL_FUZZ AND CMAKE_CXX_COMPILER_ID MATCHES "Clang" AND NOT RYACL_SANITIZE MATCHES "thread")
    set(scratch ${CMAKE_BINARY_DIR}/fuzz-scratch/${name})
    # -timeout: one input running 10 s is a hang, reported like a crash.
    add_test(NAME ${name}_run
      COMMAND sh -c "mkdir -p \"$1\" && exec \"$0\" -max_total_time=${RYACL_FUZZ_SECONDS} -timeout=10 -print_final_stats=1 -artifact_prefix=\"$1/\" \"$1\" \"$2\""
              $<TARGET_FILE:${name}> ${scratch} ${corpus})
    math(EXPR _limit "${RYACL_FUZZ_SECONDS} + 120")
    set_tests_properties(${name}_run PROPERTIES LABELS "fuzz" TIMEOUT ${_limit})
  endif()
endforeach()
