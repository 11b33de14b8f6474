#!/usr/bin/env bash
# Builds kestreld and runs it on a fresh scratch root, so that nothing of the
# host is touched. Stop it with Ctrl-C (or kill -TERM <pid>). Without a
# terminal (CI) it shows that it is up and stops again.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
cmake --preset release >/dev/null
cmake --build --preset release --target kestreld >/dev/null
root=$(tools/make-scratch-root.sh)
log="$root/private/var/root/Library/Logs/Kestrel/kestreld.log"
upcall="$root/run/kestrel/com.zorvane.kestreld.upcall"

KESTREL_ROOT="$root" build/release/kestreld &
pid=$!
trap 'kill -TERM $pid 2>/dev/null || true; wait $pid 2>/dev/null || true' EXIT
for _ in $(seq 100); do [[ -S "$upcall" ]] && break; sleep 0.05; done
[[ -S "$upcall" ]] || { echo "kestreld did not come up" >&2; exit 1; }

cat <<INFO
kestreld is up (pid $pid)
  root:          $root
  log:           $log
  upcall socket: $upcall
  stop it with:  Ctrl-C, or kill -TERM $pid
INFO
echo "--- $log"
cat "$log"
if [[ -t 0 ]]; then
  wait $pid
else
  kill -TERM $pid
  wait $pid || true
  echo "--- stopped; last lines of the log:"
  tail -n 2 "$log"
fi
trap - EXIT
