# The example clients in examples/: the C program is built (as C11, against the C interface of
# libsxreporting) so that it keeps compiling; the Python client needs no build.
add_executable(sxreporting_example examples/c/sxreporting_example.c)
set_target_properties(sxreporting_example PROPERTIES
  C_STANDARD 11 C_STANDARD_REQUIRED ON C_EXTENSIONS OFF
  # libsxreporting is C++: link with the C++ driver so its runtime comes along.
  LINKER_LANGUAGE CXX)
target_compile_options(sxreporting_example PRIVATE -pedantic)
target_link_libraries(sxreporting_example PRIVATE sxreporting)

# The end-to-end test of the examples runs this binary and the Python script.
if(TARGET Examples_test)
  add_dependencies(Examples_test sxreporting_example)
  target_compile_definitions(Examples_test PRIVATE
    SXR_C_EXAMPLE_PATH="$<TARGET_FILE:sxreporting_example>"
    SXR_PYTHON_EXAMPLE_PATH="${CMAKE_SOURCE_DIR}/examples/python/sxreporting_client.py")
endif()
