#!/bin/sh
# Builds the Debian packages from the build tree and checks what each holds (every file, each in
# the one package it belongs to), its version against packaging/debian/changelog, what it
# depends on, and that lintian finds no error or warning the packages' overrides do not explain.
# usage: packages_test.sh BUILD_DIR SOURCE_DIR VERSION
set -eu
build=$1 src=$2 version=$3
work=$(mktemp -d /tmp/sxr-packages.XXXXXX)
trap 'rm -rf "$work"' EXIT
trap 'exit 1' INT TERM

fail() {
    echo "FAIL: $*"
    cat "$work/cpack.log" 2>/dev/null || true
    exit 1
}
fail_lintian() {
    echo "FAIL: lintian"
    grep -v -F 'running with root privileges is not recommended' "$work/lintian.log" || true
    exit 1
}
multiarch=$(gcc -print-multiarch 2>/dev/null || true)

echo "== Debian packages"
(cd "$build" && cpack -G DEB -B "$work/debs") > "$work/cpack.log" 2>&1 || fail "cpack"
deb_version=$(dpkg-parsechangelog -l "$src/packaging/debian/changelog" -S Version)
[ "${deb_version%-*}" = "$version" ] ||
    fail "packaging/debian/changelog is at $deb_version, the project at $version"
deb() { ls "$work/debs/${1}_${deb_version}_"*.deb 2>/dev/null || fail "no package $1 $deb_version"; }
for package in sxreportingd libsxreporting0 libsxreporting-dev sxreporting-bench; do
    # (The CMake package's per-configuration file is named after the build type.)
    dpkg-deb -c "$(deb $package)" | awk '$1 !~ /^d/ { print $6 }' |
        sed -e 's|^\.||' -e 's|SXReportingTargets-[a-z]*\.cmake|SXReportingTargets-BUILD_TYPE.cmake|' \
        > "$work/$package.files"
    printf '%s /usr/share/doc/%s/copyright\n%s /usr/share/doc/%s/changelog.Debian.gz\n' \
        "$package" "$package" "$package" "$package" >> "$work/expected.files"
    echo "$package /usr/share/lintian/overrides/$package" >> "$work/expected.files"
done
# Every file the packages ship, each in the one package it belongs to.
ma=${multiarch:-*}
cat >> "$work/expected.files" <<LIST
sxreportingd /usr/sbin/sxreportingd
sxreportingd /usr/bin/sxreportctl
sxreportingd /usr/lib/systemd/system/sxreportingd.service
sxreportingd /usr/lib/systemd/system/sxreportingd.socket
sxreportingd /usr/lib/sysusers.d/sxreportingd.conf
sxreportingd /usr/lib/tmpfiles.d/sxreportingd.conf
sxreportingd /usr/share/bash-completion/completions/sxreportctl
sxreportingd /usr/share/man/man8/sxreportingd.8.gz
sxreportingd /usr/share/man/man1/sxreportctl.1.gz
sxreportingd /usr/share/doc/sxreportingd/examples/device.json
sxreportingd /usr/share/doc/sxreportingd/examples/fernreporting.json
libsxreporting0 /usr/lib/$ma/libsxreporting.so.0
libsxreporting0 /usr/lib/$ma/libsxreporting.so.$version
libsxreporting-dev /usr/include/sxreporting/client.h
libsxreporting-dev /usr/include/sxreporting/sxreporting.h
libsxreporting-dev /usr/include/sxreporting/types.h
libsxreporting-dev /usr/lib/$ma/libsxreporting.so
libsxreporting-dev /usr/lib/$ma/pkgconfig/sxreporting.pc
libsxreporting-dev /usr/lib/$ma/cmake/SXReporting/SXReportingConfig.cmake
libsxreporting-dev /usr/lib/$ma/cmake/SXReporting/SXReportingConfigVersion.cmake
libsxreporting-dev /usr/lib/$ma/cmake/SXReporting/SXReportingTargets.cmake
libsxreporting-dev /usr/lib/$ma/cmake/SXReporting/SXReportingTargets-BUILD_TYPE.cmake
sxreporting-bench /usr/lib/sxreporting-bench/sxreport-bench
sxreporting-bench /usr/lib/sxreporting-bench/sxreportingd
LIST
for package in sxreportingd libsxreporting0 libsxreporting-dev sxreporting-bench; do
    expected=$(sed -n "s|^$package ||p" "$work/expected.files" | sort)
    actual=$(sort "$work/$package.files")
    [ "$actual" = "$expected" ] ||
        fail "$package holds: $(echo "$actual" | tr '\n' ' '), not: $(echo "$expected" | tr '\n' ' ')"
done

depends() { dpkg-deb -f "$(deb "$1")" Depends; }
depends libsxreporting-dev | grep -q -F "libsxreporting0 (= $deb_version)" ||
    fail "libsxreporting-dev does not depend on its library's version"
depends libsxreporting-dev | grep -q -F "nlohmann-json3-dev" ||
    fail "libsxreporting-dev does not depend on what sxreporting.pc requires"
depends libsxreporting0 | grep -q -F "libstdc++6" || fail "libsxreporting0 has no shlibdeps"
depends sxreportingd | grep -q -F "libsqlite3-0" || fail "sxreportingd has no shlibdeps"
depends sxreporting-bench | grep -q -F "sxreportingd (= $deb_version)" ||
    fail "sxreporting-bench does not depend on the daemon it spawns"

# The overrides lintian honours are the ones each package ships, so a finding is either fixed in
# the packaging or explained there.
if command -v lintian >/dev/null 2>&1; then
    echo "== lintian"
    lintian --fail-on error,warning "$work"/debs/*.deb > "$work/lintian.log" 2>&1 || fail_lintian
else
    echo "== lintian: not installed (make deps installs it), skipped"
fi
echo "packages test: all checks passed"
