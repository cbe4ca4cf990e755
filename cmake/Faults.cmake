# The LD_PRELOAD library of the end-to-end fault tests (tests/faults): built with the tests,
# without sanitizers, since it is loaded into a process before anything else.
if(NOT SXR_TESTS)
  return()
endif()
add_library(sxr_faults SHARED tests/faults/EnospcShim.cpp)
target_compile_options(sxr_faults PRIVATE -fno-sanitize=all)
target_link_options(sxr_faults PRIVATE -fno-sanitize=all)
target_link_libraries(sxr_faults PRIVATE ${CMAKE_DL_LIBS})
if(TARGET Faults_test)
  add_dependencies(Faults_test sxr_faults)
  target_compile_definitions(Faults_test PRIVATE SXR_FAULTS_LIB="$<TARGET_FILE:sxr_faults>")
endif()
