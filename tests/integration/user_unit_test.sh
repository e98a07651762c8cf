#!/usr/bin/env bash
# The installed user unit serves a new account's very first call, under a real
# systemd user manager: the build is installed into an empty home's ~/.local,
# where the user manager finds the unit and the session bus the activation
# file, and a call to the service name must start quorveld through D-Bus
# activation before ~/.local/share/quorvel exists, then compose an export
# through the sandboxed media worker.
#
# The machine need not run systemd: in a private mount namespace a tmpfs on
# /run/systemd (with /run/systemd/system in it) makes `systemd --user`
# believe it does, a tmpfs on /run/user holds its runtime directory, and a
# tmpfs on $HOME makes the account new. A drop-in switches off the two
# directives a container cannot mount (ProtectKernelTunables,
# ProtectKernelLogs); everything else in the unit stays.
#
#   user_unit_test.sh BINARY_DIR
# Exits 77 (skipped) without root, unshare or a user manager that starts.
set -uo pipefail
binary_dir=$1
skip() { echo "skipped: $*"; exit 77; }

if [ -z "${QUORVEL_USER_UNIT_INSIDE:-}" ]; then
  [ "$(id -u)" -eq 0 ] || skip "needs root for a private mount namespace"
  [ -x /lib/systemd/systemd ] || skip "no systemd"
  QUORVEL_USER_UNIT_INSIDE=1 exec unshare -m --propagation private "$0" "$@" ||
    skip "unshare failed"
fi

fail() { echo "FAIL: $*" >&2; exit 1; }
work=$binary_dir/user-unit-test
rm -rf "$work" && mkdir -p "$work" || fail "cannot make $work"
trap 'systemctl --user exit >/dev/null 2>&1; sleep 0.5; kill -9 $manager 2>/dev/null; rm -rf "$work"' EXIT
manager=

audio=$work/take.wav
ffmpeg -loglevel error -f lavfi -i sine=duration=1 "$audio" || fail "ffmpeg"

mount -t tmpfs tmpfs /run/systemd 2>/dev/null || skip "cannot mount /run/systemd"
mkdir -p /run/systemd/system /run/user
mount -t tmpfs tmpfs /run/user || skip "cannot mount /run/user"
mkdir -m 700 /run/user/0
export XDG_RUNTIME_DIR=/run/user/0
export HOME=/root  # the user manager takes the account's own home
mount -t tmpfs tmpfs "$HOME" || skip "cannot mount a fresh home"
# Installed into the account's own prefix, as a user without root would (the
# build directory may be below /tmp, which PrivateTmp= hides from the unit).
prefix=$HOME/.local
cmake --install "$binary_dir" --prefix "$prefix" >/dev/null || fail "cmake --install"

units=$HOME/.config/systemd/user
mkdir -p "$units/quorveld.service.d"
printf '[Service]\nProtectKernelTunables=no\nProtectKernelLogs=no\n' \
  >"$units/quorveld.service.d/container.conf"

/lib/systemd/systemd --user >"$work/manager.log" 2>&1 &
manager=$!
for _ in $(seq 100); do
  [ -S "$XDG_RUNTIME_DIR/systemd/private" ] && break
  sleep 0.1
done
systemctl --user start dbus.socket 2>/dev/null || skip "the user manager did not start"
export DBUS_SESSION_BUS_ADDRESS=unix:path=$XDG_RUNTIME_DIR/bus

recordings=$HOME/.local/share/quorvel/Recordings
[ ! -e "$HOME/.local/share/quorvel" ] || fail "the home is not new"
timeout 30 "$prefix/bin/quorvelctl" fetch-exporting ||
  fail "the first call failed: $(systemctl --user status quorveld --no-pager 2>&1)"
[ -d "$recordings" ] || fail "no recordings directory after the first call"
"$prefix/bin/quorvelctl" new Walk "$audio" >/dev/null || fail "quorvelctl new"
timeout 60 "$prefix/bin/quorvelctl" export --cache-waveform "$recordings/Walk.m4a" -- true ||
  fail "the export failed: $(systemctl --user status quorveld --no-pager 2>&1)"
[ -s "$recordings/Walk.m4a" ] && [ -s "$recordings/Walk.waveform" ] ||
  fail "the export wrote no composed file or waveform"
echo "the installed unit served a new account's first call and an export"
