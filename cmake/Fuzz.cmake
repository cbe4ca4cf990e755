# libFuzzer targets, one per file tests/fuzz/fuzz_<name>.cpp, built only with -DSXR_FUZZ=ON and
# clang. Everything in that build carries the fuzzer's coverage hooks and ASan/UBSan: it is the
# sanitizer build (`make test-asan` configures build-asan so, `make fuzz` adds the targets).
option(SXR_FUZZ "Build the libFuzzer targets (clang only)" OFF)
if(NOT SXR_FUZZ)
  return()
endif()
if(NOT CMAKE_CXX_COMPILER_ID STREQUAL "Clang")
  message(FATAL_ERROR "SXR_FUZZ=ON needs clang: configure with CC=clang CXX=clang++")
endif()

set(SXR_FUZZ_SANITIZERS address,undefined)
# Every target defined so far gets the coverage hooks; the fuzz targets below get them too.
get_property(sxr_fuzz_existing DIRECTORY ${CMAKE_SOURCE_DIR} PROPERTY BUILDSYSTEM_TARGETS)
# Not the fault-injection shim: it is preloaded into processes and stays uninstrumented.
list(REMOVE_ITEM sxr_fuzz_existing sxr_faults)
foreach(target ${sxr_fuzz_existing})
  get_target_property(type ${target} TYPE)
  if(type MATCHES "LIBRARY|EXECUTABLE")
    target_compile_options(${target} PRIVATE -fsanitize=fuzzer-no-link,${SXR_FUZZ_SANITIZERS}
                           -fno-omit-frame-pointer -fno-sanitize-recover=undefined)
    target_link_options(${target} PRIVATE -fsanitize=${SXR_FUZZ_SANITIZERS})
  endif()
endforeach()

# The summary target runs a session over test doubles: the suite's support library when the
# suite is built, else the doubles alone (they need no test framework).
if(TARGET sxreporting_testsupport)
  set(SXR_FUZZ_SUPPORT sxreporting_testsupport)
else()
  file(GLOB SXR_FUZZ_FAKES CONFIGURE_DEPENDS tests/fakes/*.cpp)
  add_library(sxreporting_fuzzsupport STATIC ${SXR_FUZZ_FAKES} tests/support/TestEnvironment.cpp)
  target_include_directories(sxreporting_fuzzsupport PUBLIC tests)
  target_link_libraries(sxreporting_fuzzsupport PUBLIC sxr_service ${SXR_ADAPTER_LAYERS})
  target_compile_options(sxreporting_fuzzsupport PRIVATE
                         -fsanitize=fuzzer-no-link,${SXR_FUZZ_SANITIZERS} -fno-omit-frame-pointer)
  set(SXR_FUZZ_SUPPORT sxreporting_fuzzsupport)
endif()

set(SXR_FUZZ_TARGETS "")
file(GLOB SXR_FUZZ_SOURCES CONFIGURE_DEPENDS tests/fuzz/fuzz_*.cpp)
foreach(src ${SXR_FUZZ_SOURCES})
  get_filename_component(name ${src} NAME_WE)
  add_executable(${name} ${src})
  target_link_libraries(${name} PRIVATE ${SXR_FUZZ_SUPPORT})
  target_compile_options(${name} PRIVATE -fsanitize=fuzzer,${SXR_FUZZ_SANITIZERS}
                         -fno-omit-frame-pointer -fno-sanitize-recover=undefined)
  target_link_options(${name} PRIVATE -fsanitize=fuzzer,${SXR_FUZZ_SANITIZERS})
  list(APPEND SXR_FUZZ_TARGETS ${name})
endforeach()
add_custom_target(fuzz_targets DEPENDS ${SXR_FUZZ_TARGETS})
# `all` stays the suite's: the fuzz targets are built by `make fuzz` alone.
set_target_properties(${SXR_FUZZ_TARGETS} PROPERTIES EXCLUDE_FROM_ALL ON)
