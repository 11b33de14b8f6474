#!/usr/bin/env bash
# Builds kestreld and runs it on a fresh scratch root, so that nothing of the
# host is touched, and shows a short session: a container created, looked up
# again, listed, its directory and metadata file. Stop it with Ctrl-C (or kill -TERM <pid>). Without a
# terminal (CI) it shows that it is up and stops again.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
cmake --preset release >/dev/null
cmake --build --preset release --target kestreld kestrelctl >/dev/null
root=$(tools/make-scratch-root.sh)
ctl=$PWD/build/release/tools/kestrelctl
# Register kestrelctl as an installer-like client with the "allowed" entitlement.
mkdir -p "$root/etc/kestrel/signatures"
chmod 0755 "$root/etc/kestrel" "$root/etc/kestrel/signatures"
cat > "$root/etc/kestrel/signatures/kestrelctl.plist" <<PLIST
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>SigningIdentifier</key><string>com.zorvane.kestrelctl</string>
  <key>Executable</key><string>$ctl</string>
  <key>Entitlements</key><dict>
    <key>com.zorvane.private.Kestrel.allowed</key><true/>
  </dict>
</dict></plist>
PLIST
chmod 0644 "$root/etc/kestrel/signatures/kestrelctl.plist"
log="$root/private/var/root/Library/Logs/Kestrel/kestreld.log"
upcall="$root/run/kestrel/com.zorvane.kestreld.upcall"
socket="$root/run/kestrel/com.zorvane.kestreld"

KESTREL_ROOT="$root" build/release/kestreld &
pid=$!
trap 'kill -TERM $pid 2>/dev/null || true; wait $pid 2>/dev/null || true' EXIT
for _ in $(seq 100); do [[ -S "$socket" ]] && break; sleep 0.05; done
[[ -S "$socket" ]] || { echo "kestreld did not come up" >&2; exit 1; }

cat <<INFO
kestreld is up (pid $pid)
  root:           $root
  log:            $log
  request socket: $socket
  upcall socket:  $upcall
  stop it with:   Ctrl-C, or kill -TERM $pid
  afterwards:     tools/remove-scratch-root.sh $root
INFO
k() {
  echo "\$ kestrelctl $*"
  "$ctl" --root "$root" "$@"
  echo
}
k create --class Data/Application --user 501 --identifier com.example.app
k lookup --class Data/Application --user 501 --identifier com.example.app
k create --class Data/Application --user 501 --identifier com.example.notes
k list --class Data/Application --user 501
path=$("$ctl" --root "$root" --json lookup --class 2 --user 501 --identifier com.example.app |
  sed -n 's/^ *"ReplyPath": "\(.*\)",*$/\1/p')
echo "\$ ls -lan $path"
ls -lan "$path"
echo
k plist "$path/.com.zorvane.kestrel.metadata.plist"
k system-container --identifier com.zorvane.egretd
k sweep
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
