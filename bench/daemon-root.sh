# Sourced by the benchmarks that drive a running kestreld (request.sh,
# upcall.sh, launch.sh): the optimised build of what they need, a fresh
# scratch root, clients registered on it, the daemon started on it, and on
# exit the daemon stopped and the root removed.
#
#   source "$(dirname "${BASH_SOURCE[0]}")/daemon-root.sh"
#   bench_build kestrel_request_bench ...       # kestreld and kestrelctl always
#   bench_make_root                             # sets $root
#   bench_register_client NAME IDENTIFIER BINARY   # with the "allowed" entitlement
#   bench_start_daemon                          # returns once both sockets are there
here="$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)"
source_dir="$(dirname "$here")"
build_dir="$source_dir/build/bench"
root=""
daemon_pid=""

bench_build() {
  "$source_dir/scripts/setup.sh"
  cmake -S "$source_dir" -B "$build_dir" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
    -DKESTREL_BUILD_BENCHMARKS=ON -DKESTREL_BUILD_TESTS=OFF >/dev/null
  cmake --build "$build_dir" --target kestreld kestrelctl "$@" -j2
}

bench_cleanup() {
  if [[ -n "$daemon_pid" ]]; then
    kill -TERM "$daemon_pid" 2>/dev/null || true
    wait "$daemon_pid" 2>/dev/null || true
  fi
  if [[ -n "$root" ]]; then
    KESTRELCTL="$build_dir/tools/kestrelctl" "$source_dir/tools/remove-scratch-root.sh" "$root"
  fi
}

bench_make_root() {
  root="$("$source_dir/tools/make-scratch-root.sh")"
  trap bench_cleanup EXIT
}

bench_register_client() {
  local name="$1" identifier="$2" binary
  binary="$(readlink -f "$3")"
  mkdir -p "$root/etc/kestrel/signatures"
  chmod 0755 "$root/etc/kestrel" "$root/etc/kestrel/signatures"
  cat >"$root/etc/kestrel/signatures/$name.plist" <<PLIST
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>SigningIdentifier</key><string>$identifier</string>
  <key>Executable</key><string>$binary</string>
  <key>Entitlements</key><dict>
    <key>com.zorvane.private.Kestrel.allowed</key><true/>
  </dict>
</dict></plist>
PLIST
}

bench_start_daemon() {
  KESTREL_ROOT="$root" "$build_dir/kestreld" 2>/dev/null &
  daemon_pid=$!
  local socket
  for socket in com.zorvane.kestreld com.zorvane.kestreld.upcall; do
    for _ in $(seq 200); do [[ -S "$root/run/kestrel/$socket" ]] && break; sleep 0.05; done
  done
}
