#!/usr/bin/env bash
# Crash injection: kestreld built with crash points (the "crash" preset, a
# debug build) is killed at each named point of create, replace, wipe,
# stage-for-delete, death row, recovery and start-up clean-up, many times,
# each on a fresh root; after every restart the store must hold each
# container in its state before or after the request (see docs/testing.md).
#
#   scripts/crash-test.sh [trials] [point...]     # default 60 trials over every point
set -euo pipefail
cd "$(dirname "$0")/.."
trials="${1:-60}"
shift || true
scripts/setup.sh
cmake --preset crash >/dev/null
cmake --build --preset crash --target kestreld kestrelctl kestrel_crash_test >/dev/null
build=build/crash

template="$(tools/make-scratch-root.sh)"
trap 'rm -rf "$template"' EXIT
mkdir -p "$template/etc/kestrel/signatures"
chmod 0755 "$template/etc/kestrel" "$template/etc/kestrel/signatures"
register() {  # name identifier binary
  cat >"$template/etc/kestrel/signatures/$1.plist" <<PLIST
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>SigningIdentifier</key><string>$2</string>
  <key>Executable</key><string>$(readlink -f "$3")</string>
  <key>Entitlements</key><dict>
    <key>com.zorvane.private.Kestrel.allowed</key><true/>
  </dict>
</dict></plist>
PLIST
  chmod 0644 "$template/etc/kestrel/signatures/$1.plist"
}
register crash com.zorvane.kestrel.crash "$build/tools/kestrel_crash_test"
register ctl com.zorvane.kestrelctl "$build/tools/kestrelctl"

points=()
for p in "$@"; do points+=(--point "$p"); done
"$build/tools/kestrel_crash_test" --daemon "$build/kestreld" --ctl "$build/tools/kestrelctl" \
  --template "$template" --trials "$trials" "${points[@]}"
