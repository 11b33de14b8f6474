#!/usr/bin/env bash
# The request benchmark: starts kestreld (release build) on a fresh scratch
# root, registers the benchmark as a client, measures lookups against Ping and
# creation against the same system calls without the daemon, and writes
# bench/results/request-<stamp>/ (request_bench.json, latencies.csv and
# latencies.png).
#
#   bench/request.sh [seconds-per-phase]      # default 3
set -euo pipefail
source "$(dirname "${BASH_SOURCE[0]}")/daemon-root.sh"
seconds="${1:-3}"
if ! command -v gnuplot >/dev/null; then
  DEBIAN_FRONTEND=noninteractive apt-get install -y -qq --no-install-recommends gnuplot-nox >/dev/null
fi

bench_build kestrel_request_bench
bench_make_root
bench="$build_dir/bench/kestrel_request_bench"
bench_register_client bench com.zorvane.kestrel.bench "$bench"
socket="$root/run/kestrel/com.zorvane.kestreld"
bench_start_daemon

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
