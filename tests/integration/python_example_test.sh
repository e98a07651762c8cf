#!/usr/bin/env bash
# The Python example holds a preview session, exports the recording meanwhile
# and sees ExportingCompositionAVURLsChanged, against the real quorveld on a
# private bus; afterwards the daemon lists no session.
#   python_example_test.sh BINARY_DIR
# Exits 77 (skipped) without PyGObject.
set -uo pipefail
binary_dir=$1
source_dir=$(cd "$(dirname "$0")/../.." && pwd)
python=/usr/bin/python3
"$python" -c 'from gi.repository import Gio' 2>/dev/null || { echo "skipped: no PyGObject"; exit 77; }
fail() { echo "FAIL: $*" >&2; exit 1; }

work=$(mktemp -d)
bus=
daemon=
trap 'kill $daemon $bus 2>/dev/null; rm -rf "$work"' EXIT
mkfifo "$work/address"
dbus-daemon --session --nofork --nopidfile --address="unix:dir=$work" --print-address=3 \
  3>"$work/address" 2>/dev/null &
bus=$!
read -r -t 30 DBUS_SESSION_BUS_ADDRESS <"$work/address"
export DBUS_SESSION_BUS_ADDRESS
[ -n "$DBUS_SESSION_BUS_ADDRESS" ] || fail "dbus-daemon did not start"
"$binary_dir/bin/quorveld" --recordings-dir "$work/Recordings" --idle-exit-after 0 2>"$work/log" &
daemon=$!
gdbus wait --session --timeout 20 org.quorvel.SavedRecordingService || fail "quorveld did not start"

ffmpeg -loglevel error -f lavfi -i sine=duration=1 "$work/take.wav" || fail "ffmpeg"
recording=$("$binary_dir/bin/quorvelctl" --recordings-dir "$work/Recordings" new Walk \
  "$work/take.wav" "$work/take.wav") || fail "quorvelctl new"
output=$("$python" "$source_dir/examples/python/hold_preview.py" "$recording") ||
  fail "the example failed: $output"
echo "$output"
grep -q "^holding preview of " <<<"$output" || fail "no preview was held"
grep -q "^exporting set changed: \['file://.*Walk.m4a'\]" <<<"$output" ||
  fail "the exporting signal was not seen with the recording in the set"
grep -q "^exported: " <<<"$output" || fail "the export was not answered"
left=$("$binary_dir/bin/quorvelctl" --json sessions) || fail "quorvelctl sessions"
[ "$left" = '{"sessions":[]}' ] || fail "sessions left behind: $left"
