#!/bin/sh
# Installs the build into a staging root and uses it the way a system does: checks the installed
# files, the programs' versions and the bash completion, starts the staged daemon through socket
# activation, talks to it with the staged sxreportctl, and builds small clients against the
# staged headers and library through pkg-config and the CMake package. Those two builds are left
# out under the sanitizers, whose runtime an outside compiler line does not link.
# usage: install_test.sh BUILD_DIR SOURCE_DIR SANITIZED(0|1) VERSION
set -eu
build=$1 src=$2 sanitized=$3 version=$4
here=$src/tests/e2e/install
work=$(mktemp -d /tmp/sxr-install.XXXXXX)
stage=$work/stage/usr
activator=""
cleanup() {
    [ -z "$activator" ] || kill "$activator" 2>/dev/null || true
    rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 1' INT TERM
fail() {
    echo "FAIL: $*"
    for log in "$work"/*.log; do [ -f "$log" ] && { echo "--- $log"; cat "$log"; }; done
    exit 1
}

# Polls the command until it succeeds; fails after 15 s.
wait_for() {
    tries=0
    until "$@"; do
        tries=$((tries + 1))
        [ "$tries" -lt 150 ] || fail "timed out waiting for: $*"
        sleep 0.1
    done
}

echo "== install into $stage"
cmake --install "$build" --prefix "$stage" > "$work/install.log" 2>&1 || fail "cmake --install"

# Which file each package ships is the packages test's; here, what the staged tree must be to run.
echo "== installed files"
# The benchmark spawns the daemon beside it by default: a link to the installed one.
[ "$(readlink -f "$stage/lib/sxreporting-bench/sxreportingd")" = "$(readlink -f "$stage/sbin/sxreportingd")" ] ||
    fail "the benchmark's daemon link does not lead to the installed daemon"
library=$(find "$stage" -name 'libsxreporting.so.*.*.*')
[ -n "$library" ] || fail "libsxreporting.so.X.Y.Z is not installed"
libdir=$(dirname "$library")
readelf -d "$library" | grep -q 'SONAME.*\[libsxreporting\.so\.0\]' || fail "SONAME is not libsxreporting.so.0"
grep -q "^ExecStart=$stage/sbin/sxreportingd " "$stage/lib/systemd/system/sxreportingd.service" ||
    fail "the service does not start the installed daemon"

echo "== --version"
for program in sbin/sxreportingd bin/sxreportctl lib/sxreporting-bench/sxreport-bench; do
    [ "$("$stage/$program" --version)" = "$(basename "$program") $version" ] ||
        fail "$program --version does not print $(basename "$program") $version"
done

echo "== bash completion"
# The candidates bash offers after the words given; the last word is the one being completed.
complete_words() {
    bash -c '. "$1"; shift; COMP_WORDS=("$@"); COMP_CWORD=$(($# - 1)); _sxreportctl
        printf "%s\n" "${COMPREPLY[@]}"' completion \
        "$stage/share/bash-completion/completions/sxreportctl" sxreportctl "$@" | sort | tr '\n' ' '
}
expect_completion() {  # EXPECTED WORDS...
    expected=$1
    shift
    got=$(complete_words "$@")
    [ "$got" = "$expected " ] || fail "completing '$*': '$got', not '$expected'"
}
expect_completion "delete read then write" defaults ""
expect_completion "send set-type sizes start status stop" --json create 42 "then" s
expect_completion "--state-dir" --socket /x/y --st
expect_completion "$stage/lib/systemd/system/sxreportingd.service" --state-dir "$stage/lib/systemd/system/sxreportingd.se"
for command in $("$stage/bin/sxreportctl" --help | sed -n '/^Commands:/,/^$/p' | sed -n 's/^  \([a-z][a-z-]*\).*/\1/p'); do
    complete_words "" | grep -q -w -e "$command" || fail "the completion does not offer $command"
done

if command -v systemd-sysusers >/dev/null 2>&1 && [ "$(id -u)" = 0 ]; then
    echo "== systemd-sysusers --root"
    mkdir -p "$work/root/etc"
    systemd-sysusers --root="$work/root" "$stage/lib/sysusers.d/sxreportingd.conf" \
        > "$work/sysusers.log" 2>&1 || fail "systemd-sysusers"
    grep -q '^sxreportingd:' "$work/root/etc/passwd" || fail "no user sxreportingd"
    grep -q '^sxreporting:' "$work/root/etc/group" || fail "no group sxreporting"

    echo "== systemd-tmpfiles --root"
    systemd-tmpfiles --root="$work/root" --create "$stage/lib/tmpfiles.d/sxreportingd.conf" \
        > "$work/tmpfiles.log" 2>&1 || fail "systemd-tmpfiles"
    id_of() { awk -F: -v name="$2" '$1 == name { print $3 }' "$work/root/etc/$1"; }
    # The socket's directory reachable by the clients' group, the configuration by the service's.
    [ "$(stat -c '%a %u %g' "$work/root/run/sxreportingd")" = \
        "750 $(id_of passwd sxreportingd) $(id_of group sxreporting)" ] ||
        fail "/run/sxreportingd is not sxreportingd:sxreporting 0750"
    [ "$(stat -c '%a %u %g' "$work/root/etc/sxreportingd")" = "750 0 $(id_of group sxreportingd)" ] ||
        fail "/etc/sxreportingd is not root:sxreportingd 0750"
fi

echo "== socket activation"
socket=$work/run/com.vendra.audio.kitbench.reporting.service
mkdir -p "$work/run"
daemon_args="--runtime-dir $work/run --state-dir $work/lib --config-dir $work/etc \
    --diagnostic-logs-dir $work/logs --kestrel-root $work/kestrel"
# Two passed sockets are one too many: a clear error at start, not a guess.
# shellcheck disable=SC2086
systemd-socket-activate -l "$work/run/a.sock" -l "$work/run/b.sock" "$stage/sbin/sxreportingd" \
    $daemon_args > "$work/two.log" 2>&1 &
wait_for test -S "$work/run/b.sock"
"$stage/bin/sxreportctl" --socket "$work/run/a.sock" status > /dev/null 2>&1 || true
status=0
wait $! || status=$?
[ "$status" = 1 ] || fail "two passed sockets: exit status $status"
grep -q 'passed 2 descriptors; expected one listening Unix stream socket' "$work/two.log" ||
    fail "two passed sockets: no error line"
# shellcheck disable=SC2086
systemd-socket-activate -l "$socket" "$stage/sbin/sxreportingd" $daemon_args > "$work/daemon.log" 2>&1 &
activator=$!
wait_for test -S "$socket"
# Listening, but no daemon yet: the activator has not run it.
grep -q 'ready' "$work/daemon.log" && fail "the daemon started before any connection"
ctl="$stage/bin/sxreportctl --socket $socket"
$ctl create 42 "then" valid 42 > "$work/ctl.log" 2>&1 || fail "create then valid"
grep -q '^reporterID 42, serviceType' "$work/ctl.log" || fail "valid 42 did not find the session"
# The log is written a moment after the work that logs it.
wait_for grep -q '(socket activated)' "$work/daemon.log"
[ "$(cat /proc/$activator/comm)" = sxreportingd ] || fail "the daemon is not the activated process"
$ctl status > "$work/status.log" 2>&1 || fail "status"
grep -q '^reporting enabled: yes' "$work/status.log" || fail "status did not answer"
$ctl valid 42 > "$work/ctl.log" 2>&1 || fail "valid 42 on a new connection"
grep -q '^reporterID 0, serviceType 65535' "$work/ctl.log" ||
    fail "the session outlived the connection that made it"

if [ "$sanitized" = 1 ]; then
    echo "== sanitizer build: no client builds against the staged library"
else
    echo "== clients built with pkg-config and with find_package(SXReporting)"
    # shellcheck disable=SC2046
    PKG_CONFIG_PATH="$libdir/pkgconfig" g++ -std=c++20 -o "$work/client" "$here/client.cpp" \
        $(PKG_CONFIG_PATH="$libdir/pkgconfig" pkg-config --cflags --libs sxreporting) \
        -Wl,-rpath,"$libdir" > "$work/compile.log" 2>&1 || fail "pkg-config build"
    ldd "$work/client" | grep -q "$libdir/libsxreporting.so.0" ||
        fail "the client does not load the staged library"
    (cmake -S "$here/consumer" -B "$work/consumer" -DCMAKE_PREFIX_PATH="$stage" \
        -DCMAKE_BUILD_RPATH="$libdir" && cmake --build "$work/consumer") \
        > "$work/consumer.log" 2>&1 || fail "CMake package build"
    for client in "$work/client" "$work/consumer/consumer"; do
        "$client" "$socket" > "$work/client.log" 2>&1 || fail "$client"
        grep -q 'created true, valid reporterID 7 serviceType' "$work/client.log" ||
            fail "$client answers"
    done
fi
echo "install test: all checks passed"
