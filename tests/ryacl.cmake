# ryacl check's JSON and SARIF output, read back by a script; the SARIF log
# also validated by the SARIF Multitool when tools/deps could install it
# (otherwise that test is reported as skipped).
find_package(Python3 COMPONENTS Interpreter)
if(Python3_FOUND)
  set(_formats ${CMAKE_CURRENT_SOURCE_DIR}/ryacl_check_formats.py)
  add_test(NAME ryacl_check_formats COMMAND ${Python3_EXECUTABLE} ${_formats} $<TARGET_FILE:ryacl_cmd>)
  add_test(NAME ryacl_check_sarif_validate
    COMMAND ${Python3_EXECUTABLE} ${_formats} $<TARGET_FILE:ryacl_cmd> --validate)
  set_tests_properties(ryacl_check_sarif_validate PROPERTIES SKIP_RETURN_CODE 77 TIMEOUT 900)
endif()

# What the subcommands share with each other, tested in process.
if(TARGET test_ryacl_cmd_api)
  target_link_libraries(test_ryacl_cmd_api PRIVATE ryacl_cmd_objects)
endif()
