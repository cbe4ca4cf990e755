# The project's version as a header for the programs' --version. Only they include it, so a new
# version rebuilds their entry points (the tools': their command lines) and nothing else.
configure_file(${CMAKE_SOURCE_DIR}/cmake/SXVersion.h.in ${CMAKE_BINARY_DIR}/generated/SXVersion.h
               @ONLY)
foreach(program sxreportingd sxreportctl_parts sxreport-bench_parts)
  target_include_directories(${program} PRIVATE ${CMAKE_BINARY_DIR}/generated)
endforeach()
