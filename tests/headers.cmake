# The public headers compile cleanly as C99 and as C++ with every warning an
# error, using only the install-style include directory.
set(_hdr_inc ${CMAKE_SOURCE_DIR}/security/ACL/lib)
add_test(NAME headers_c99
  COMMAND ${CMAKE_C_COMPILER} -std=c99 -Wall -Wextra -Wpedantic -Werror -fsyntax-only
          -I${_hdr_inc} ${CMAKE_CURRENT_SOURCE_DIR}/headers/use_headers.c)
add_test(NAME headers_cxx
  COMMAND ${CMAKE_CXX_COMPILER} -std=c++20 -Wall -Wextra -Wpedantic -Werror -fsyntax-only
          -I${_hdr_inc} ${CMAKE_CURRENT_SOURCE_DIR}/headers/use_headers.cpp)

# Recording a named message checks its arguments at compile time: the right
# call compiles, each wrong one fails with its own diagnostic.
set(_msg_compile ${CMAKE_CXX_COMPILER} -std=c++20 -Wall -Wextra -Wpedantic -Werror -fsyntax-only
    -I${_hdr_inc} -I${RYACL_GEN_DIR} ${CMAKE_CURRENT_SOURCE_DIR}/headers/msg_calls.cpp)
add_test(NAME headers_msg_right COMMAND ${_msg_compile} -DCASE=0)
set(_msg_cases "1\;takes another number of arguments" "2\;takes another number of arguments"
    "3\;wrong kind for this message" "4\;wrong kind for this message")
foreach(c ${_msg_cases})
  list(GET c 0 n)
  list(GET c 1 diag)
  add_test(NAME headers_msg_wrong_${n} COMMAND ${_msg_compile} -DCASE=${n})
  # The diagnostic, not just any failure: a test that merely fails to
  # compile would pass for the wrong reason.
  set_tests_properties(headers_msg_wrong_${n} PROPERTIES PASS_REGULAR_EXPRESSION "${diag}")
endforeach()
