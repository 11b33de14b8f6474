#!/usr/bin/env bash
# The request benchmark: starts kestreld (release build) on a fresh scratch
# root, registers the benchmark as a client, measures lookups against Ping and
# creation against the same system calls without the daemon, and writes
# bench/results/request-<stamp>/ (request_bench.json, latencies.csv and
# latencies.png).
#
#   bench/request.sh [seconds-per-phase]      # default 3
set -euo pipefail
here="$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)"
source_dir="$(dirname "$here")"
build_dir="$source_dir/build/bench"
seconds="${1:-3}"
"$source_dir/scripts/setup.sh"
if ! command -v gnuplot >/dev/null; then
  DEBIAN_FRONTEND=noninteractive apt-get install -y -qq --no-install-recommends gnuplot-nox >/dev/null
fi

cmake -S "$source_dir" -B "$build_dir" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DKESTREL_BUILD_BENCHMARKS=ON -DKESTREL_BUILD_TESTS=OFF >/dev/null
cmake --build "$build_dir" --target kestreld kestrelctl kestrel_request_bench -j2

root="$("$source_dir/tools/make-scratch-root.sh")"
bench="$(readlink -f "$build_dir/bench/kestrel_request_bench")"
mkdir -p "$root/etc/kestrel/signatures"
chmod 0755 "$root/etc/kestrel" "$root/etc/kestrel/signatures"
cat > "$root/etc/kestrel/signatures/bench.plist" <<PLIST
<?xml version="1.0" encoding="UTF-8"?>
<plist version="1.0"><dict>
  <key>SigningIdentifier</key><string>com.zorvane.kestrel.bench</string>
  <key>Executable</key><string>$bench</string>
  <key>Entitlements</key><dict>
    <key>com.zorvane.private.Kestrel.allowed</key><true/>
  </dict>
</dict></plist>
PLIST
socket="$root/run/kestrel/com.zorvane.kestreld"
KESTREL_ROOT="$root" "$build_dir/kestreld" 2>/dev/null &
pid=$!
trap 'kill -TERM $pid 2>/dev/null || true; wait $pid 2>/dev/null || true; KESTRELCTL="$build_dir/tools/kestrelctl" "$source_dir/tools/remove-scratch-root.sh" "$root"' EXIT
for _ in $(seq 200); do [[ -S "$socket" ]] && break; sleep 0.05; done

out="$here/results/request-$(date -u +%Y%m%dT%H%M%SZ)"
"$bench" --address "unix:path=$socket" --root "$root" --out "$out" --seconds "$seconds"
{
  echo "machine: $(nproc) cores, $(awk '/MemTotal/ {printf "%.0f GiB", $2/1048576}' /proc/meminfo),"\
    "$(uname -r), $(date -u +%Y-%m-%d)"
} >"$out/machine.txt"

# Latency distributions (CDF per phase and client count), log scale.
awk -F, 'NR > 1 { print > ("'"$out"'/" $1 "-" $2 ".dat") }' "$out/latencies.csv"
for f in "$out"/*.dat; do sort -n -t, -k3 "$f" -o "$f"; done
plots=()
for f in "$out"/*.dat; do
  name="$(basename "$f" .dat)"
  n="$(wc -l <"$f")"
  plots+=("'$f' using 3:(\$0/$n) with lines lw 2 title '$name'")
done
gnuplot <<GP
set terminal png size 1100,700
set output '$out/latencies.png'
set datafile separator ','
set logscale x
set xlabel 'latency (microseconds)'
set ylabel 'fraction of requests'
set key bottom right
set grid
set title 'kestreld request latency: lookups vs Ping floor; creation vs syscall baseline'
plot $(IFS=,; echo "${plots[*]}")
GP
rm -f "$out"/*.dat
echo "results: $out"
