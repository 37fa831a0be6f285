# The shared library's interface against the committed baseline
# cmake/libryacl.abi: every exported symbol with its version node and kind,
# and the version nodes with the node each inherits from.  An export added,
# lost or moved to another node fails here before any client notices.
# After an intended change, update the baseline with:
#   cmake -DLIB=build/dev/lib/libryacl.so -DBASELINE=cmake/libryacl.abi -DUPDATE=ON -P tests/install_abi.cmake
#
# Included by tests/CMakeLists.txt, this file registers the test; run with
# cmake -P (as the test does), it is the test.
if(NOT CMAKE_SCRIPT_MODE_FILE)
  add_test(NAME abi_baseline
    COMMAND ${CMAKE_COMMAND} -DLIB=$<TARGET_FILE:ryacl> -DBASELINE=${CMAKE_SOURCE_DIR}/cmake/libryacl.abi
            -P ${CMAKE_CURRENT_LIST_FILE})
  return()
endif()

execute_process(COMMAND readelf --wide --dyn-syms --version-info ${LIB}
  RESULT_VARIABLE rc OUTPUT_VARIABLE dump ERROR_VARIABLE err)
if(NOT rc EQUAL 0)
  message(FATAL_ERROR "readelf ${LIB}: ${err}")
endif()
string(REPLACE ";" "\\;" dump "${dump}")
string(REPLACE "\n" ";" dump "${dump}")
set(abi "")
set(in_verdef OFF)
foreach(line IN LISTS dump)
  # Defined global symbols: "Num: Value Size Type Bind Vis Ndx Name@@NODE".
  if(line MATCHES "^ *[0-9]+: [0-9a-f]+ +[0-9]+ (FUNC|OBJECT|TLS) +(GLOBAL|WEAK) +[A-Z]+ +[0-9]+ ([^ @]+)(@@?)([^ ]+)?$")
    list(APPEND abi "symbol ${CMAKE_MATCH_3}${CMAKE_MATCH_4}${CMAKE_MATCH_5} ${CMAKE_MATCH_1}")
  elseif(line MATCHES "^ *[0-9]+: [0-9a-f]+ +[0-9]+ (FUNC|OBJECT|TLS) +(GLOBAL|WEAK) +[A-Z]+ +[0-9]+ ([^ ]+)$")
    list(APPEND abi "symbol ${CMAKE_MATCH_3} ${CMAKE_MATCH_1} (unversioned)")
  elseif(line MATCHES "^Version definition section")
    set(in_verdef ON)
  elseif(line MATCHES "^Version (needs|symbols) section")
    set(in_verdef OFF)
  elseif(in_verdef AND line MATCHES "Flags: none +Index: [0-9]+ +Cnt: [0-9]+ +Name: ([^ ]+)")
    set(node ${CMAKE_MATCH_1})
    list(APPEND abi "node ${node}")
  elseif(in_verdef AND line MATCHES "Parent 1: ([^ ]+)")
    list(APPEND abi "node ${node} inherits ${CMAKE_MATCH_1}")
  endif()
endforeach()
list(SORT abi)
list(JOIN abi "\n" abi)
set(abi "${abi}\n")

if(UPDATE)
  file(WRITE ${BASELINE} "${abi}")
  message(STATUS "wrote ${BASELINE}")
  return()
endif()
file(READ ${BASELINE} expected)
if(NOT abi STREQUAL expected)
  set(built ${CMAKE_CURRENT_BINARY_DIR}/libryacl.abi.built)
  file(WRITE ${built} "${abi}")
  execute_process(COMMAND diff -u ${BASELINE} ${built})
  message(FATAL_ERROR "The exported interface of ${LIB} differs from ${BASELINE} (above: - baseline, + built). "
    "If the change is intended, update the baseline as tests/install_abi.cmake says.")
endif()
message(STATUS "exported interface matches ${BASELINE}")
