#!/usr/bin/env bash
# Installs a built tree into a temporary prefix, builds the two example consumers against
# it (examples/cmake-consumer through find_package, examples/pkgconfig-consumer through
# pkg-config) and has each find its data container on a stowlyd started from that prefix.
# This is what a program outside the tree sees: only the installed headers, library and
# package files, and the installed daemon.
#   install-consumers.sh BUILD_DIR SOURCE_DIR
set -euo pipefail
build=$1
source=$2
if [ "$(id -u)" -ne 0 ]; then
    echo "SKIP: the daemon runs as root"
    exit 77
fi

work=$(mktemp -d /tmp/stowly-install-XXXXXX)
chmod 0755 "$work"
prefix=$work/prefix
root=$work/root
daemon_pid=""
cleanup() {
    if [ -n "$daemon_pid" ]; then
        kill -TERM "$daemon_pid" 2>/dev/null || true
        wait "$daemon_pid" 2>/dev/null || true
    fi
    # The first-boot semaphore outlives the daemon; the metadata files are immutable.
    [ -x "$prefix/bin/stowlyctl" ] && "$prefix/bin/stowlyctl" --root "$root" device reboot >/dev/null 2>&1 || true
    chattr -R -i "$work" 2>/dev/null || true
    rm -rf "$work"
}
trap cleanup EXIT
fail() {
    echo "FAIL: $*"
    [ -f "$root/stowlyd.stderr" ] && sed 's/^/  stowlyd: /' "$root/stowlyd.stderr" | tail -20
    exit 1
}

cmake --install "$build" --prefix "$prefix" >"$work/install.log" || { cat "$work/install.log"; fail "cmake --install"; }

# Every installed header compiles on its own against the installed headers alone: none
# includes a header of the tree that was left out.
include=$(find "$prefix" -type d -path '*/include/stowly' -print -quit)
[ -n "$include" ] || fail "no include/stowly installed"
for header in $(cd "$include" && find . -name '*.h' | sed 's|^\./||'); do
    echo "#include \"$header\"" | c++ -std=c++20 -fsyntax-only -I"$include" -x c++ - ||
        fail "installed header $header does not compile on its own"
done

# The consumers, each built in a directory of its own from the installed files only.
cmake -S "$source/examples/cmake-consumer" -B "$work/cmake-consumer" -G Ninja \
    -DCMAKE_PREFIX_PATH="$prefix" >"$work/cmake-consumer.log" 2>&1 &&
    cmake --build "$work/cmake-consumer" >>"$work/cmake-consumer.log" 2>&1 ||
    { cat "$work/cmake-consumer.log"; fail "building examples/cmake-consumer"; }
pc=$(find "$prefix" -name stowly.pc -print -quit)
[ -n "$pc" ] || fail "no stowly.pc installed"
mkdir "$work/pkgconfig-consumer"
PKG_CONFIG_PATH="$(dirname "$pc")" make -s -C "$work/pkgconfig-consumer" \
    -f "$source/examples/pkgconfig-consumer/Makefile" PKG_CONFIG="pkg-config --define-variable=prefix=$prefix" \
    >"$work/pkgconfig-consumer.log" 2>&1 ||
    { cat "$work/pkgconfig-consumer.log"; fail "building examples/pkgconfig-consumer"; }
consumers=("$work/cmake-consumer/stowly-lookup" "$work/pkgconfig-consumer/stowly-lookup")
library=$(find "$prefix" -name libstowly.so.0 -print -quit)
[ -n "$library" ] || fail "no libstowly.so.0 installed"
export LD_LIBRARY_PATH=$(dirname "$library")
for consumer in "${consumers[@]}"; do
    # Read whole before the match: grep -q leaving early would fail the pipe (pipefail).
    loaded=$(ldd "$consumer")
    grep -q "=> $library" <<<"$loaded" || { echo "$loaded"; fail "$consumer does not load $library"; }
done

# A device of its own: the mobile user, developer mode for stowlyctl's installer identity,
# and both consumers in the client registry as one app.
mkdir -p "$root/etc/stowly/clients.d"
printf 'root:x:0:0:root:/private/var/root:/bin/sh\nmobile:x:501:501:Mobile:/private/var/mobile:/bin/sh\n' >"$root/etc/passwd"
printf 'root:x:0:\nmobile:x:501:\nsystemusers:x:950:mobile\n' >"$root/etc/group"
cat >"$root/etc/stowly/stowlyd.plist" <<'PLIST'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict><key>DeveloperMode</key><true/></dict></plist>
PLIST
cat >"$root/installer.plist" <<'PLIST'
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict><key>com.vorlane.private.Stowly.allowed</key><true/></dict></plist>
PLIST
n=0
for consumer in "${consumers[@]}"; do
    n=$((n + 1))
    cat >"$root/etc/stowly/clients.d/consumer$n.plist" <<PLIST
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
<key>CodeSigningIdentifier</key><string>com.example.consumer</string>
<key>Executable</key><string>$consumer</string>
<key>Entitlements</key><dict/>
</dict></plist>
PLIST
done

"$prefix/libexec/stowlyd" --root "$root" --idle-timeout 0 2>"$root/stowlyd.stderr" &
daemon_pid=$!
socket=$root/run/stowly/stowlyd.sock
for _ in $(seq 200); do
    [ -S "$socket" ] && break
    kill -0 "$daemon_pid" 2>/dev/null || fail "the installed stowlyd exited at start"
    sleep 0.05
done
[ -S "$socket" ] || fail "the installed stowlyd did not open its socket"

"$prefix/bin/stowlyctl" --root "$root" --as com.vorlane.setwrightd --entitlements "$root/installer.plist" \
    create com.example.consumer --class 2 >/dev/null || fail "stowlyctl create"
expected=$("$prefix/bin/stowlyctl" --root "$root" --as com.vorlane.setwrightd --entitlements "$root/installer.plist" \
    --json lookup com.example.consumer --class 2 | sed -n 's/.*"ReplyPath": *"\([^"]*\)".*/\1/p')
[ -n "$expected" ] || fail "stowlyctl lookup gave no path"

for consumer in "${consumers[@]}"; do
    got=$("$consumer" "$socket") || fail "$consumer exited with $?"
    [ "$got" = "$expected" ] || fail "$consumer found '$got', not '$expected'"
    # The socket may also come from the environment.
    got=$(STOWLY_SOCKET=$socket "$consumer") || fail "$consumer with STOWLY_SOCKET exited with $?"
    [ "$got" = "$expected" ] || fail "$consumer (STOWLY_SOCKET) found '$got', not '$expected'"
done
echo "both consumers found $expected"
