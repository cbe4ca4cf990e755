# What `cmake --install` puts on a system, and the Debian packages made of it (one install
# component each): sxreportingd (the daemon, sxreportctl, systemd units, tmpfiles.d and
# sysusers.d files, manual pages, bash completion, example configuration), libsxreporting0 (the
# shared library), libsxreporting-dev (headers, the .so link, pkg-config file, CMake package)
# and sxreporting-bench (the benchmark, out of PATH). docs/operations.md has the layout.

# The library goes to the multiarch directory (lib/x86_64-linux-gnu, ...) whatever the prefix,
# so that the packages can be co-installed across architectures; GNUInstallDirs does so only
# when configured with the prefix /usr, and CPack installs to /usr whatever it was. A plain
# variable, so that it wins over a cached "lib" of an older configuration.
if(CMAKE_LIBRARY_ARCHITECTURE)
  set(CMAKE_INSTALL_LIBDIR lib/${CMAKE_LIBRARY_ARCHITECTURE})
endif()
include(GNUInstallDirs)
include(CMakePackageConfigHelpers)

set(SXR_SYSTEMD_UNIT_DIR "lib/systemd/system" CACHE STRING
    "Where the systemd units go, relative to the install prefix")
set(SXR_SYSUSERS_DIR "lib/sysusers.d" CACHE STRING
    "Where the sysusers.d file goes, relative to the install prefix")
set(SXR_TMPFILES_DIR "lib/tmpfiles.d" CACHE STRING
    "Where the tmpfiles.d file goes, relative to the install prefix")
set(SXR_BENCH_DIR lib/sxreporting-bench)
# Each package's copyright and changelog go to its own /usr/share/doc/<package>, and its
# lintian overrides (packaging/debian/<package>.lintian-overrides, else the common ones) to
# /usr/share/lintian/overrides/<package>.
function(sxr_install_package_docs component package)
  install(FILES ${CMAKE_SOURCE_DIR}/packaging/debian/copyright
                ${CMAKE_BINARY_DIR}/packaging/changelog.Debian.gz
          DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/doc/${package} COMPONENT ${component})
  set(overrides ${CMAKE_SOURCE_DIR}/packaging/debian/${package}.lintian-overrides)
  if(NOT EXISTS ${overrides})
    set(overrides ${CMAKE_SOURCE_DIR}/packaging/debian/lintian-overrides)
  endif()
  install(FILES ${overrides} DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/lintian/overrides
          RENAME ${package} COMPONENT ${component})
endfunction()

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
# Every symbol resolved at link time; a sanitizer build leaves the sanitizers' own to the
# program that loads the library (clang links their runtimes into programs only).
if(NOT SXR_SANITIZE AND NOT SXR_FUZZ)
  target_link_options(sxreporting_shared PRIVATE -Wl,--no-undefined)
endif()

# --- Programs, library, headers -----------------------------------------------------------------
install(TARGETS sxreportingd RUNTIME DESTINATION ${CMAKE_INSTALL_SBINDIR} COMPONENT daemon)
install(TARGETS sxreportctl RUNTIME DESTINATION ${CMAKE_INSTALL_BINDIR} COMPONENT daemon)
# The benchmark is for whoever measures a build, not for every device: out of PATH, beside a
# link to the installed daemon, which its --spawn starts by default.
install(TARGETS sxreport-bench RUNTIME DESTINATION ${SXR_BENCH_DIR} COMPONENT bench)
file(MAKE_DIRECTORY ${CMAKE_BINARY_DIR}/packaging)
file(RELATIVE_PATH SXR_BENCH_TO_SBIN /usr/${SXR_BENCH_DIR} /usr/${CMAKE_INSTALL_SBINDIR})
file(CREATE_LINK ${SXR_BENCH_TO_SBIN}/sxreportingd ${CMAKE_BINARY_DIR}/packaging/sxreportingd
     SYMBOLIC)
install(FILES ${CMAKE_BINARY_DIR}/packaging/sxreportingd DESTINATION ${SXR_BENCH_DIR}
        COMPONENT bench)
install(TARGETS sxreporting_shared EXPORT SXReportingTargets
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} NAMELINK_SKIP COMPONENT library)
install(TARGETS sxreporting_shared
  LIBRARY DESTINATION ${CMAKE_INSTALL_LIBDIR} NAMELINK_ONLY COMPONENT development)
install(DIRECTORY include/sxreporting DESTINATION ${CMAKE_INSTALL_INCLUDEDIR}
  COMPONENT development FILES_MATCHING PATTERN "*.h")

# Installs `template` as `destination`/`name`, configured with the install-time prefix (CPack
# installs under /usr whatever prefix the build was configured with). It is written straight
# to its destination, so concurrent installs to different prefixes do not share a file.
function(sxr_install_configured template name destination component)
  install(CODE "
    set(SXR_PREFIX \"\${CMAKE_INSTALL_PREFIX}\")
    set(SXR_SBINDIR \"\${CMAKE_INSTALL_PREFIX}/${CMAKE_INSTALL_SBINDIR}\")
    set(SXR_LIBDIR_NAME \"${CMAKE_INSTALL_LIBDIR}\")
    set(SXR_INCLUDEDIR_NAME \"${CMAKE_INSTALL_INCLUDEDIR}\")
    set(SXR_VERSION \"${PROJECT_VERSION}\")
    set(out \"\$ENV{DESTDIR}\${CMAKE_INSTALL_PREFIX}/${destination}/${name}\")
    message(STATUS \"Installing: \${out}\")
    configure_file(\"${template}\" \"\${out}\" @ONLY)
    list(APPEND CMAKE_INSTALL_MANIFEST_FILES \"\${out}\")" COMPONENT ${component})
endfunction()

# --- pkg-config and CMake package ---------------------------------------------------------------
sxr_install_configured(${CMAKE_SOURCE_DIR}/cmake/sxreporting.pc.in sxreporting.pc
                       ${CMAKE_INSTALL_LIBDIR}/pkgconfig development)
set(SXR_CMAKE_DIR ${CMAKE_INSTALL_LIBDIR}/cmake/SXReporting)
install(EXPORT SXReportingTargets NAMESPACE SXReporting:: DESTINATION ${SXR_CMAKE_DIR}
        COMPONENT development)
configure_package_config_file(cmake/SXReportingConfig.cmake.in
  ${CMAKE_BINARY_DIR}/packaging/SXReportingConfig.cmake INSTALL_DESTINATION ${SXR_CMAKE_DIR})
write_basic_package_version_file(${CMAKE_BINARY_DIR}/packaging/SXReportingConfigVersion.cmake
  COMPATIBILITY SameMajorVersion)
install(FILES ${CMAKE_BINARY_DIR}/packaging/SXReportingConfig.cmake
              ${CMAKE_BINARY_DIR}/packaging/SXReportingConfigVersion.cmake
        DESTINATION ${SXR_CMAKE_DIR} COMPONENT development)

# --- systemd, tmpfiles.d, sysusers.d ------------------------------------------------------------
sxr_install_configured(${CMAKE_SOURCE_DIR}/packaging/systemd/sxreportingd.service.in
                       sxreportingd.service ${SXR_SYSTEMD_UNIT_DIR} daemon)
install(FILES packaging/systemd/sxreportingd.socket DESTINATION ${SXR_SYSTEMD_UNIT_DIR}
  COMPONENT daemon)
install(FILES packaging/systemd/sxreportingd.sysusers DESTINATION ${SXR_SYSUSERS_DIR}
  RENAME sxreportingd.conf COMPONENT daemon)
install(FILES packaging/systemd/sxreportingd.tmpfiles DESTINATION ${SXR_TMPFILES_DIR}
  RENAME sxreportingd.conf COMPONENT daemon)

# --- Documentation: changelog, manual pages from the programs' own --help, bash completion -----
set(SXR_PACKAGE_DOCS ${CMAKE_BINARY_DIR}/packaging/changelog.Debian.gz)
add_custom_command(OUTPUT ${CMAKE_BINARY_DIR}/packaging/changelog.Debian.gz
  COMMAND sh -c "gzip -9n < \"$0\" > \"$1\"" ${CMAKE_SOURCE_DIR}/packaging/debian/changelog
          ${CMAKE_BINARY_DIR}/packaging/changelog.Debian.gz
  DEPENDS ${CMAKE_SOURCE_DIR}/packaging/debian/changelog VERBATIM)
foreach(component_package daemon:sxreportingd library:libsxreporting0
        development:libsxreporting-dev bench:sxreporting-bench)
  string(REPLACE ":" ";" pair ${component_package})
  sxr_install_package_docs(${pair})
endforeach()
install(FILES examples/config/device.json examples/config/fernreporting.json
  DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/doc/sxreportingd/examples COMPONENT daemon)

# Generated from the program, so it always knows every command and option.
set(SXR_COMPLETION ${CMAKE_BINARY_DIR}/packaging/sxreportctl.bash)
add_custom_command(OUTPUT ${SXR_COMPLETION}
  COMMAND sh ${CMAKE_SOURCE_DIR}/packaging/completion/generate.sh $<TARGET_FILE:sxreportctl>
          ${SXR_COMPLETION}
  DEPENDS sxreportctl ${CMAKE_SOURCE_DIR}/packaging/completion/generate.sh
          ${CMAKE_SOURCE_DIR}/packaging/completion/completion.bash
  COMMENT "Generating the bash completion of sxreportctl" VERBATIM)
list(APPEND SXR_PACKAGE_DOCS ${SXR_COMPLETION})
install(FILES ${SXR_COMPLETION} DESTINATION ${CMAKE_INSTALL_DATAROOTDIR}/bash-completion/completions
  RENAME sxreportctl COMPONENT daemon)

find_program(SXR_HELP2MAN help2man)
set(SXR_MAN_DIR ${CMAKE_BINARY_DIR}/man)
if(SXR_HELP2MAN)
  set(h2m ${CMAKE_SOURCE_DIR}/packaging/man)
  set(help2man ${SXR_HELP2MAN} --no-info)
  # Each page is installed compressed, as Debian wants; the plain one is for the tests.
  add_custom_command(OUTPUT ${SXR_MAN_DIR}/sxreportingd.8 ${SXR_MAN_DIR}/sxreportingd.8.gz
    COMMAND ${CMAKE_COMMAND} -E make_directory ${SXR_MAN_DIR}
    COMMAND ${help2man} --section=8 "--name=the reporting service of the audio stack"
            --include=${h2m}/sxreportingd.h2m --output=${SXR_MAN_DIR}/sxreportingd.8
            $<TARGET_FILE:sxreportingd>
    COMMAND gzip -9nkf ${SXR_MAN_DIR}/sxreportingd.8
    DEPENDS sxreportingd ${h2m}/sxreportingd.h2m
    COMMENT "Generating sxreportingd.8" VERBATIM)
  add_custom_command(OUTPUT ${SXR_MAN_DIR}/sxreportctl.1 ${SXR_MAN_DIR}/sxreportctl.1.gz
    COMMAND ${CMAKE_COMMAND} -E make_directory ${SXR_MAN_DIR}
    COMMAND sh ${h2m}/commands.sh $<TARGET_FILE:sxreportctl> ${SXR_MAN_DIR}/commands.h2m
    COMMAND ${help2man} --section=1 "--name=talk to the audio reporting service"
            --include=${SXR_MAN_DIR}/commands.h2m --include=${h2m}/sxreportctl.h2m
            --output=${SXR_MAN_DIR}/sxreportctl.1 $<TARGET_FILE:sxreportctl>
    COMMAND gzip -9nkf ${SXR_MAN_DIR}/sxreportctl.1
    DEPENDS sxreportctl ${h2m}/sxreportctl.h2m ${h2m}/commands.sh
    COMMENT "Generating sxreportctl.1" VERBATIM)
  list(APPEND SXR_PACKAGE_DOCS ${SXR_MAN_DIR}/sxreportingd.8.gz ${SXR_MAN_DIR}/sxreportctl.1.gz)
  install(FILES ${SXR_MAN_DIR}/sxreportingd.8.gz DESTINATION ${CMAKE_INSTALL_MANDIR}/man8
    COMPONENT daemon)
  install(FILES ${SXR_MAN_DIR}/sxreportctl.1.gz DESTINATION ${CMAKE_INSTALL_MANDIR}/man1
    COMPONENT daemon)
else()
  message(STATUS "help2man not found: no manual pages (apt-get install help2man)")
endif()
add_custom_target(package_docs ALL DEPENDS ${SXR_PACKAGE_DOCS})

# --- Tests of the installed tree ----------------------------------------------------------------
if(SXR_TESTS)
  add_test(NAME install.staged
    COMMAND sh ${CMAKE_SOURCE_DIR}/tests/e2e/install/install_test.sh
            ${CMAKE_BINARY_DIR} ${CMAKE_SOURCE_DIR} $<BOOL:${SXR_SANITIZE}> ${PROJECT_VERSION})
  set_tests_properties(install.staged PROPERTIES LABELS e2e TIMEOUT 300)
  # The packages are made from the normal build; a sanitized one would not run elsewhere.
  find_program(SXR_DPKG_SHLIBDEPS dpkg-shlibdeps)
  if(SXR_DPKG_SHLIBDEPS AND NOT SXR_SANITIZE)
    add_test(NAME install.packages
      COMMAND sh ${CMAKE_SOURCE_DIR}/tests/e2e/install/packages_test.sh
              ${CMAKE_BINARY_DIR} ${CMAKE_SOURCE_DIR} ${PROJECT_VERSION})
    set_tests_properties(install.packages PROPERTIES LABELS e2e TIMEOUT 300)
  endif()
endif()

# --- Debian packages: `cpack -G DEB` in the build directory -------------------------------------
# Installing (and so packaging) takes what is built and builds nothing, not the whole test
# suite: `make install` and `make package` build first.
set(CMAKE_SKIP_INSTALL_ALL_DEPENDENCY ON)
set(CPACK_GENERATOR DEB)
set(CPACK_DEB_COMPONENT_INSTALL ON)
set(CPACK_COMPONENTS_ALL daemon library development bench)
set(CPACK_PACKAGE_NAME sxreportingd)
set(CPACK_PACKAGE_VERSION ${PROJECT_VERSION})
set(CPACK_DEBIAN_PACKAGE_RELEASE 1)
set(SXR_DEB_VERSION ${PROJECT_VERSION}-${CPACK_DEBIAN_PACKAGE_RELEASE})
set(CPACK_PACKAGE_CONTACT "Audio reporting maintainers <audio-reporting@sxreporting.example>")
set(CPACK_PACKAGING_INSTALL_PREFIX /usr)
set(CPACK_STRIP_FILES ON)
set(CPACK_DEBIAN_FILE_NAME DEB-DEFAULT)
# libc6, libstdc++6, libsqlite3-0, ... as dpkg-shlibdeps finds them in the binaries.
set(CPACK_DEBIAN_PACKAGE_SHLIBDEPS ON)
set(CPACK_DEBIAN_PACKAGE_CONTROL_STRICT_PERMISSION ON)

set(CPACK_DEBIAN_DAEMON_PACKAGE_NAME sxreportingd)
set(CPACK_DEBIAN_DAEMON_PACKAGE_SECTION admin)
set(CPACK_DEBIAN_DAEMON_DESCRIPTION "reporting service of the audio stack
The daemon sxreportingd, started by systemd socket activation, and its
command-line client sxreportctl. Audio clients create reporting sessions and
send them messages; the service keeps analytics events, power-log entries
and a server-reporting spool.")
# libcurl4 is loaded at run time (by the otlp-http backend), so dpkg-shlibdeps cannot see it.
set(CPACK_DEBIAN_DAEMON_PACKAGE_DEPENDS "libcurl4")
set(CPACK_DEBIAN_DAEMON_PACKAGE_RECOMMENDS "systemd")
set(CPACK_DEBIAN_DAEMON_PACKAGE_CONTROL_EXTRA
  ${CMAKE_SOURCE_DIR}/packaging/debian/postinst
  ${CMAKE_SOURCE_DIR}/packaging/debian/prerm
  ${CMAKE_SOURCE_DIR}/packaging/debian/postrm)

set(CPACK_DEBIAN_LIBRARY_PACKAGE_NAME libsxreporting0)
set(CPACK_DEBIAN_LIBRARY_PACKAGE_SECTION libs)
set(CPACK_DEBIAN_LIBRARY_DESCRIPTION "client library of the audio reporting service
libsxreporting talks to sxreportingd over its Unix socket: one method per
protocol operation, replies as callbacks or futures, each with a time-out.")
# The shlibs file of libsxreporting0 (the only package with a shared library).
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS ON)
set(CPACK_DEBIAN_PACKAGE_GENERATE_SHLIBS_POLICY ">=")
set(CPACK_DEBIAN_LIBRARY_PACKAGE_CONTROL_EXTRA ${CMAKE_SOURCE_DIR}/packaging/debian/triggers)

set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_NAME libsxreporting-dev)
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_SECTION libdevel)
set(CPACK_DEBIAN_DEVELOPMENT_DESCRIPTION "client library of the audio reporting service (development files)
The C++20 and C headers of libsxreporting, its pkg-config file (sxreporting)
and CMake package (find_package(SXReporting)).")
# What sxreporting.pc requires and SXReportingConfig.cmake finds.
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_DEPENDS
  "libsxreporting0 (= ${SXR_DEB_VERSION}), nlohmann-json3-dev (>= 3)")
set(CPACK_DEBIAN_DEVELOPMENT_PACKAGE_SUGGESTS "pkg-config")

set(CPACK_DEBIAN_BENCH_PACKAGE_NAME sxreporting-bench)
set(CPACK_DEBIAN_BENCH_PACKAGE_SECTION devel)
set(CPACK_DEBIAN_BENCH_DESCRIPTION "benchmark driver of the audio reporting service
sxreport-bench drives sxreportingd with many client connections and reports
throughput, latency, CPU and memory, with a MessagePack echo server as the
baseline. It is installed as /usr/lib/sxreporting-bench/sxreport-bench.")
set(CPACK_DEBIAN_BENCH_PACKAGE_DEPENDS "sxreportingd (= ${SXR_DEB_VERSION})")
include(CPack)
