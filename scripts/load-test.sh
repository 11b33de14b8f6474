#!/usr/bin/env bash
# The load test: kestreld (release build) on a fresh scratch root, N clients
# with a mixed workload for S seconds, every answer checked; then
# `kestrelctl fsck` checks the store on disk and against the daemon's cache.
#
#   scripts/load-test.sh [seconds] [clients]      # default 20 s, 4 clients
#   KESTREL_PRESET=tsan scripts/load-test.sh 60   # the daemon under TSan (or asan)
#   KESTREL_TEST_DAEMON_WRAPPER=tools/confined-daemon.sh scripts/load-test.sh
#                                      # the daemon confined as its unit confines it
set -euo pipefail
cd "$(dirname "$0")/.."
seconds="${1:-20}"
clients="${2:-4}"
scripts/setup.sh
preset="${KESTREL_PRESET:-release}"
build_dir="build/$preset"
cmake --preset "$preset" >/dev/null
cmake --build --preset "$preset" --target kestreld kestrelctl kestrel_load_test >/dev/null

root="$(tools/make-scratch-root.sh)"
mkdir -p "$root/etc/kestrel/signatures"
chmod 0755 "$root/etc/kestrel" "$root/etc/kestrel/signatures"
register() {  # name identifier binary
  cat >"$root/etc/kestrel/signatures/$1.plist" <<PLIST
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>SigningIdentifier</key><string>$2</string>
  <key>Executable</key><string>$(readlink -f "$3")</string>
  <key>Entitlements</key><dict>
    <key>com.zorvane.private.Kestrel.allowed</key><true/>
  </dict>
</dict></plist>
PLIST
}
register load com.zorvane.kestrel.load "$build_dir/tools/kestrel_load_test"
register ctl com.zorvane.kestrelctl "$build_dir/tools/kestrelctl"

socket="$root/run/kestrel/com.zorvane.kestreld"
# A sanitizer build writes its reports next to the root, where the end looks.
reports="$root.sanitizer"
KESTREL_ROOT="$root" ASAN_OPTIONS="log_path=$reports" \
  UBSAN_OPTIONS="log_path=$reports:print_stacktrace=1" \
  TSAN_OPTIONS="log_path=$reports:second_deadlock_stack=1:suppressions=$PWD/tools/tsan.supp" \
  ${KESTREL_TEST_DAEMON_WRAPPER:+"$KESTREL_TEST_DAEMON_WRAPPER"} "$build_dir/kestreld" 2>/dev/null &
pid=$!
status=0
stop_daemon() {
  kill -TERM "$pid" 2>/dev/null || true
  wait "$pid" 2>/dev/null || true
}
cleanup() {
  stop_daemon
  # A failed run keeps its root for a look at the store and the log.
  if [[ $status == 0 ]]; then KESTRELCTL="$build_dir/tools/kestrelctl" tools/remove-scratch-root.sh "$root"; rm -f "$reports".*; else echo "root kept: $root"; fi
}
trap cleanup EXIT
for _ in $(seq 200); do [[ -S "$socket" ]] && break; sleep 0.05; done

"$build_dir/tools/kestrel_load_test" --address "unix:path=$socket" --clients "$clients" \
  --seconds "$seconds" || status=1
echo "--- kestrelctl fsck"
"$build_dir/tools/kestrelctl" --root "$root" fsck || status=1
log="$root/private/var/root/Library/Logs/Kestrel/kestreld.log"
if grep -q "Got exception" "$log"; then
  echo "the daemon caught exceptions:"; grep "Got exception" "$log"; status=1
fi
# Every sweep removes what it finds; nothing may have been put aside in /tmp.
if [[ -n $(ls -A "$root/tmp") ]]; then
  echo "death row put items aside in $root/tmp:"; ls -A "$root/tmp"; status=1
fi
kill -0 "$pid" 2>/dev/null || { echo "the daemon is gone"; status=1; }
stop_daemon
if compgen -G "$reports.*" >/dev/null; then
  echo "sanitizer reports:"; cat "$reports".*; status=1
fi
[[ $status == 0 ]] && echo "load test passed" || echo "load test FAILED"
exit $status
