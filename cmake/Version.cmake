# The project's version as a header for the programs' --version. Only they include it, so a new
# version rebuilds their entry points and nothing else.
configure_file(${CMAKE_SOURCE_DIR}/cmake/SXVersion.h.in ${CMAKE_BINARY_DIR}/generated/SXVersion.h
               @ONLY)
foreach(program sxreportingd sxreportctl sxreport-bench)
  target_include_directories(${program} PRIVATE ${CMAKE_BINARY_DIR}/generated)
endforeach()
