#!/usr/bin/env bash
# The upcall benchmark: starts kestreld (release build) on a fresh scratch
# root, then measures process-containers upcalls for an existing app against
# a datagram echoed by a trivial server on the same kind of socket, and writes
# bench/results/upcall-<stamp>/upcall_bench.json.
#
#   bench/upcall.sh [seconds]      # default 6, split over three rounds of each
set -euo pipefail
source "$(dirname "${BASH_SOURCE[0]}")/daemon-root.sh"
seconds="${1:-6}"

bench_build kestrel_upcall_bench
bench_make_root
# An installer (a copy of kestrelctl with "allowed") records the app's
# code-signing information, as an installation does: its data class is 2.
mkdir -p "$root/bin"
cp "$build_dir/tools/kestrelctl" "$root/bin/installer"
installer="$root/bin/installer"
bench_register_client installer com.zorvane.kestrel.bench.installer "$installer"
socket="$root/run/kestrel/com.zorvane.kestreld.upcall"
bench_start_daemon

"$installer" --root "$root" call 18 Identifier=str:com.zorvane.kestrel.bench.app \
  'CodeSigningInfo=plist:{}' \
  'OptionsDictionary=plist:{"com.zorvane.Kestrel.DataContainerClass":2}' >/dev/null

out="$here/results/upcall-$(date -u +%Y%m%dT%H%M%SZ)"
"$build_dir/bench/kestrel_upcall_bench" --socket "$socket" --out "$out" --seconds "$seconds"
echo "machine: $(nproc) cores, $(uname -r), $(date -u +%Y-%m-%d)" >"$out/machine.txt"
echo "results: $out"
