# What `cmake --install` puts on a system, and the Debian package made of it: the daemon, the
# tools, the client library as a shared library with its headers, pkg-config file and CMake
# package, the manual pages generated from the programs' --help, and the systemd units.
include(GNUInstallDirs)
include(CMakePackageConfigHelpers)

set(SXR_SYSTEMD_UNIT_DIR "lib/systemd/system" CACHE STRING
    "Where the systemd units go, relative to the install prefix")
set(SXR_SYSUSERS_DIR "lib/sysusers.d" CACHE STRING
    "Where the sysusers.d file goes, relative to the install prefix")

# --- libsxreporting.so -------------------------------------------------------------------------
# The build tree keeps the static `sxreporting` for the tools and tests; what is installed is a
# shared library with a SONAME built from the same objects, so that applications pick up fixes
# without relinking. The wire codec (sxreporting_common) is linked into it privately.
set_target_properties(sxreporting PROPERTIES POSITION_INDEPENDENT_CODE ON)
add_library(sxreporting_shared SHARED $<TARGET_OBJECTS:sxreporting>)
add_dependencies(sxreporting_shared sxreporting)
set_target_properties(sxreporting_shared PROPERTIES
  OUTPUT_NAME sxreporting
  EXPORT_NAME sxreporting
  VERSION ${PROJECT_VERSION}
  SOVERSION ${PROJECT_VERSION_MAJOR})
target_include_directories(sxreporting_shared INTERFACE
  $<BUILD_INTERFACE:${CMAKE_SOURCE_DIR}/include>
  $<INSTALL_INTERFACE:${CMAKE_INSTALL_INCLUDEDIR}>)
target_compile_features(sxreporting_shared INTERFACE cxx_std_20)
target_link_libraries(sxreporting_shared
  PUBLIC nlohmann_json::nlohmann_json Threads::Threads
  PRIVATE sxreporting_common)
target_link_options(sxreporting_shared PRIVATE -Wl,--no-undefined)

# --- Programs, library, headers -----------------------------------------------------------------
install(TARGETS sxreportingd RUNTIME DESTINATION ${CMAKE_INSTALL_SBINDIR})
foreach(tool sxreportctl sxreport-bench)
  if(TARGET ${tool})
    install(TARGETS ${tool} RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR})
  endif()
endforeach()
install(TARGETS sxreporting_shared EXPORT SXReportingTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} NAMELINK_SKIP)
install(TARGETS sxreporting_shared
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} NAMELINK_ONLY)
install(DIRECTORY include/sxreporting DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}
  FILES_MATCHING PATTERN "*.h")

# Installs `template` as `destination`/`name`, configured with the install-time prefix (CPack
# installs under /usr whatever prefix the build was configured with). It is written straight
# to its destination, so concurrent installs to different prefixes do not share a file.
function(sxr_install_configured template name destination)
  install(CODE "
    set(SXR_PREFIX \"\${CMAKE_INSTALL_PREFIX}\")
    set(SXR_SBINDIR \"\${CMAKE_INSTALL_PREFIX}/${CMAKE_INSTALL_SBINDIR}\")
    set(SXR_LIBDIR_NAME \"${CMAKE_INSTALL_LIBDIR}\")
    set(SXR_INCLUDEDIR_NAME \"${CMAKE_INSTALL_INCLUDEDIR}\")
    set(SXR_VERSION \"${PROJECT_VERSION}\")
    set(out \"\$ENV{DESTDIR}\${CMAKE_INSTALL_PREFIX}/${destination}/${name}\")
    message(STATUS \"Installing: \${out}\")
    configure_file(\"${template}\" \"\${out}\" @ONLY)
    list(APPEND CMAKE_INSTALL_MANIFEST_FILES \"\${out}\")")
endfunction()

# --- pkg-config and CMake package ---------------------------------------------------------------
sxr_install_configured(${CMAKE_SOURCE_DIR}/cmake/sxreporting.pc.in sxreporting.pc
                       ${CMAKE_INSTALL_LIBDIR}/pkgconfig)
set(SXR_CMAKE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/SXReporting)
install(EXPORT SXReportingTargets NAMESPACE SXReporting:: DESTINATION ${SXR_CMAKE_DIR})
configure_package_config_file(cmake/SXReportingConfig.cmake.in
  ${CMAKE_BINARY_DIR}/packaging/SXReportingConfig.cmake INSTALL_DESTINATION ${SXR_CMAKE_DIR})
write_basic_package_version_file(${CMAKE_BINARY_DIR}/packaging/SXReportingConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${CMAKE_BINARY_DIR}/packaging/SXReportingConfig.cmake
              ${CMAKE_BINARY_DIR}/packaging/SXReportingConfigVersion.cmake
        DESTINATION ${SXR_CMAKE_DIR})

# --- systemd ------------------------------------------------------------------------------------
sxr_install_configured(${CMAKE_SOURCE_DIR}/packaging/systemd/sxreportingd.service.in
                       sxreportingd.service ${SXR_SYSTEMD_UNIT_DIR})
install(FILES packaging/systemd/sxreportingd.socket DESTINATION ${SXR_SYSTEMD_UNIT_DIR})
install(FILES packaging/systemd/sxreportingd.sysusers DESTINATION ${SXR_SYSUSERS_DIR}
  RENAME sxreportingd.conf)

# --- Manual pages, from the programs' own --help ------------------------------------------------
find_program(SXR_HELP2MAN help2man)
set(SXR_MAN_DIR ${CMAKE_BINARY_DIR}/man)
if(SXR_HELP2MAN)
  set(h2m ${CMAKE_SOURCE_DIR}/packaging/man)
  set(help2man ${SXR_HELP2MAN} --no-info --version-string=${PROJECT_VERSION})
  add_custom_command(OUTPUT ${SXR_MAN_DIR}/sxreportingd.8
    COMMAND ${CMAKE_COMMAND} -E make_directory ${SXR_MAN_DIR}
    COMMAND ${help2man} --section=8 "--name=the reporting service of the audio stack"
            --include=${h2m}/sxreportingd.h2m --output=${SXR_MAN_DIR}/sxreportingd.8
            $<TARGET_FILE:sxreportingd>
    DEPENDS sxreportingd ${h2m}/sxreportingd.h2m
    COMMENT "Generating sxreportingd.8" VERBATIM)
  add_custom_command(OUTPUT ${SXR_MAN_DIR}/sxreportctl.1
    COMMAND ${CMAKE_COMMAND} -E make_directory ${SXR_MAN_DIR}
    COMMAND sh ${h2m}/commands.sh $<TARGET_FILE:sxreportctl> ${SXR_MAN_DIR}/commands.h2m
    COMMAND ${help2man} --section=1 "--name=talk to the audio reporting service"
            --include=${SXR_MAN_DIR}/commands.h2m --include=${h2m}/sxreportctl.h2m
            --output=${SXR_MAN_DIR}/sxreportctl.1 $<TARGET_FILE:sxreportctl>
    DEPENDS sxreportctl ${h2m}/sxreportctl.h2m ${h2m}/commands.sh
    COMMENT "Generating sxreportctl.1" VERBATIM)
  add_custom_target(man ALL DEPENDS ${SXR_MAN_DIR}/sxreportingd.8 ${SXR_MAN_DIR}/sxreportctl.1)
  install(FILES ${SXR_MAN_DIR}/sxreportingd.8 DESTINATION ${CMAKE_INSTALL_MANDIR}/man8)
  install(FILES ${SXR_MAN_DIR}/sxreportctl.1 DESTINATION ${CMAKE_INSTALL_MANDIR}/man1)
else()
  message(STATUS "help2man not found: no manual pages (apt-get install help2man)")
endif()

# --- Tests of the installed tree ----------------------------------------------------------------
if(SXR_TESTS)
  add_test(NAME install.staged
    COMMAND sh ${CMAKE_SOURCE_DIR}/tests/e2e/install/install_test.sh
            ${CMAKE_BINARY_DIR} ${CMAKE_SOURCE_DIR} $<BOOL:${SXR_SANITIZE}>)
  set_tests_properties(install.staged PROPERTIES LABELS e2e TIMEOUT 300)
  if(SXR_HELP2MAN)
    add_test(NAME install.manpages
      COMMAND sh ${CMAKE_SOURCE_DIR}/tests/e2e/install/manpages_test.sh
              $<TARGET_FILE:sxreportingd> $<TARGET_FILE:sxreportctl> ${SXR_MAN_DIR})
    set_tests_properties(install.manpages PROPERTIES LABELS e2e TIMEOUT 60)
  endif()
endif()

# --- Debian package: `cpack -G DEB` in the build directory --------------------------------------
set(CPACK_GENERATOR DEB)
set(CPACK_PACKAGE_NAME sxreportingd)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_PACKAGE_DESCRIPTION_SUMMARY "reporting service of the audio stack")
set(CPACK_PACKAGE_DESCRIPTION
  "The daemon sxreportingd, started by systemd socket activation, its command-line client\
 sxreportctl, and the client library libsxreporting with headers, pkg-config file and CMake\
 package.")
set(CPACK_PACKAGE_CONTACT "Audio reporting maintainers <audio-reporting@localhost>")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
set(CPACK_DEBIAN_PACKAGE_SECTION admin)
# libc6, libstdc++6, libsqlite3-0, ... as dpkg-shlibdeps finds them in the binaries; libcurl4
# is loaded at run time (by the otlp-http backend), so dpkg-shlibdeps cannot see it.
set(CPACK_DEBIAN_PACKAGE_DEPENDS "libcurl4")
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_DEBIAN_PACKAGE_RECOMMENDS "systemd")
set(CPACK_DEBIAN_PACKAGE_SUGGESTS "nlohmann-json3-dev, pkg-config")
set(CPACK_DEBIAN_PACKAGE_CONTROL_EXTRA
  ${CMAKE_SOURCE_DIR}/packaging/debian/postinst
  ${CMAKE_SOURCE_DIR}/packaging/debian/prerm
  ${CMAKE_SOURCE_DIR}/packaging/debian/postrm
  ${CMAKE_SOURCE_DIR}/packaging/debian/triggers)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)
include(CPack)
