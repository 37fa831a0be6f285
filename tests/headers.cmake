# The public headers compile cleanly as C99 and as C++ with every warning an
# error, using only the install-style include directory.
set(_hdr_inc ${CMAKE_SOURCE_DIR}/security/ACL/lib)
add_test(NAME headers_c99
  COMMAND ${CMAKE_C_COMPILER} -std=c99 -Wall -Wextra -Wpedantic -Werror -fsyntax-only
          -I${_hdr_inc} ${CMAKE_CURRENT_SOURCE_DIR}/headers/use_headers.c)
add_test(NAME headers_cxx
  COMMAND ${CMAKE_CXX_COMPILER} -std=c++20 -Wall -Wextra -Wpedantic -Werror -fsyntax-only
          -I${_hdr_inc} ${CMAKE_CURRENT_SOURCE_DIR}/headers/use_headers.cpp)
