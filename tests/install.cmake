if(NOT RYACL_SANITIZE)  # an uninstrumented client cannot load an instrumented library
add_test(NAME install_layout COMMAND ${CMAKE_CURRENT_SOURCE_DIR}/install_layout.sh ${CMAKE_BINARY_DIR})
endif()
