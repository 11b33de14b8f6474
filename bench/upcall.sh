#!/usr/bin/env bash
# The upcall benchmark: starts kestreld (release build) on a fresh scratch
# root, then measures process-containers upcalls for an existing app against
# a datagram echoed by a trivial server on the same kind of socket, and writes
# bench/results/upcall-<stamp>/upcall_bench.json.
#
#   bench/upcall.sh [seconds]      # default 6, split over three rounds of each
set -euo pipefail
here="$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)"
source_dir="$(dirname "$here")"
build_dir="$source_dir/build/bench"
seconds="${1:-6}"
"$source_dir/scripts/setup.sh"

cmake -S "$source_dir" -B "$build_dir" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DKESTREL_BUILD_BENCHMARKS=ON -DKESTREL_BUILD_TESTS=OFF >/dev/null
cmake --build "$build_dir" --target kestreld kestrelctl kestrel_upcall_bench -j2

root="$("$source_dir/tools/make-scratch-root.sh")"
# An installer (a copy of kestrelctl with "allowed") records the app's
# code-signing information, as an installation does: its data class is 2.
mkdir -p "$root/etc/kestrel/signatures" "$root/bin"
chmod 0755 "$root/etc/kestrel" "$root/etc/kestrel/signatures"
cp "$build_dir/tools/kestrelctl" "$root/bin/installer"
installer="$(readlink -f "$root/bin/installer")"
cat > "$root/etc/kestrel/signatures/installer.plist" <<PLIST
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>SigningIdentifier</key><string>com.zorvane.kestrel.bench.installer</string>
  <key>Executable</key><string>$installer</string>
  <key>Entitlements</key><dict>
    <key>com.zorvane.private.Kestrel.allowed</key><true/>
  </dict>
</dict></plist>
PLIST
socket="$root/run/kestrel/com.zorvane.kestreld.upcall"
KESTREL_ROOT="$root" "$build_dir/kestreld" 2>/dev/null &
pid=$!
trap 'kill -TERM $pid 2>/dev/null || true; wait $pid 2>/dev/null || true; KESTRELCTL="$build_dir/tools/kestrelctl" "$source_dir/tools/remove-scratch-root.sh" "$root"' EXIT
for _ in $(seq 200); do [[ -S "$root/run/kestrel/com.zorvane.kestreld" ]] && break; sleep 0.05; done

"$installer" --root "$root" call 18 Identifier=str:com.zorvane.kestrel.bench.app \
  'CodeSigningInfo=plist:{}' \
  'OptionsDictionary=plist:{"com.zorvane.Kestrel.DataContainerClass":2}' >/dev/null

out="$here/results/upcall-$(date -u +%Y%m%dT%H%M%SZ)"
"$build_dir/bench/kestrel_upcall_bench" --socket "$socket" --out "$out" --seconds "$seconds"
echo "machine: $(nproc) cores, $(uname -r), $(date -u +%Y-%m-%d)" >"$out/machine.txt"
echo "results: $out"
