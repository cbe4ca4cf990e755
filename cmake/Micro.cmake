# Micro benchmarks of the daemon's hot functions (Google Benchmark). Built only when the
# benchmark library is installed; run by hand (build/sxr-micro), never by ctest.
find_package(benchmark QUIET)
if(benchmark_FOUND)
  file(GLOB SXR_MICRO_SOURCES CONFIGURE_DEPENDS ${CMAKE_CURRENT_LIST_DIR}/../bench/micro/*.cpp)
  if(SXR_MICRO_SOURCES)
    add_executable(sxr-micro ${SXR_MICRO_SOURCES})
    target_precompile_headers(sxr-micro PRIVATE <nlohmann/json.hpp> <msgpack.hpp>)
    target_link_libraries(sxr-micro PRIVATE sxr_service sxr_sqlite benchmark::benchmark
                          benchmark::benchmark_main)
  endif()
endif()
