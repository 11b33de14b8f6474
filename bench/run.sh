#!/usr/bin/env bash
# Builds the benchmarks optimised (build/bench), runs every one of them and
# writes their JSON to bench/results/, then prints each figure as a ratio to
# the baseline measured in the same run. Needs root (the scratch roots chown).
#
#   bench/run.sh                      # 3 repetitions, medians
#   REPETITIONS=5 bench/run.sh --benchmark_filter=Lock
set -euo pipefail

here="$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)"
source_dir="$(dirname "$here")"
build_dir="$source_dir/build/bench"
results_dir="$here/results"
repetitions="${REPETITIONS:-3}"
"$source_dir/scripts/setup.sh"

# The same optimisation as the shipped daemon (the release preset).
cmake -S "$source_dir" -B "$build_dir" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
  -DKESTREL_BUILD_BENCHMARKS=ON >/dev/null
cmake --build "$build_dir" --target bench/all -j2

mkdir -p "$results_dir"
stamp="$(date -u +%Y%m%dT%H%M%SZ)"
outputs=()
for binary in "$build_dir"/bench/kestrel_*_bench; do
  [[ -x "$binary" ]] || continue
  name="$(basename "$binary")"
  # These two talk to a running daemon: bench/request.sh and bench/upcall.sh run them.
  case "$name" in kestrel_request_bench | kestrel_upcall_bench) continue ;; esac
  out="$results_dir/${name}-${stamp}.json"
  echo "== $name"
  "$binary" --benchmark_repetitions="$repetitions" --benchmark_report_aggregates_only=true \
    --benchmark_out="$out" --benchmark_out_format=json "$@"
  outputs+=("$out")
done

python3 - "${outputs[@]}" <<'PY'
import json, sys

# Figure -> its baseline; the rest of the run name (threads, ...) must match.
PAIRS = [
    ("BM_IdentifierLockWriting", "BM_SharedMutexWriting"),
    ("BM_IdentifierLockReading", "BM_SharedMutexReading"),
    ("BM_IdentifierLockWriting", "BM_DesignFloor"),
    ("BM_IdentifierLockReading", "BM_DesignFloor"),
    ("BM_CacheLookup", "BM_PlainLstat"),
    ("BM_CacheRebuild", "BM_PlainReadMetadataFiles"),
    ("BM_ProtectionChange", "BM_BareXattrWalk"),
]
TO_NS = {"ns": 1.0, "us": 1e3, "ms": 1e6, "s": 1e9}

medians = {}
for path in sys.argv[1:]:
    with open(path) as f:
        data = json.load(f)
    for b in data.get("benchmarks", []):
        if b.get("run_type") == "aggregate" and b.get("aggregate_name") != "median":
            continue
        if b.get("error_occurred"):
            continue
        scale = TO_NS[b.get("time_unit", "ns")]
        medians[b["run_name"]] = (b["real_time"] * scale, b["cpu_time"] * scale)

def show(ns):
    for unit, scale in (("s", 1e9), ("ms", 1e6), ("us", 1e3)):
        if ns >= scale:
            return f"{ns / scale:.3f} {unit}"
    return f"{ns:.1f} ns"

print()
print("Medians (real time) and ratios to the baseline of the same run:")
shown = set()
for figure, baseline in PAIRS:
    for name in sorted(medians):
        if not name.startswith(figure):
            continue
        rest = name[len(figure):]
        base = baseline + rest
        if base not in medians:
            continue
        (fr, fc), (br, bc) = medians[name], medians[base]
        print(f"  {name:45s} {show(fr):>12s}  vs {base:45s} {show(br):>12s}"
              f"  ratio {fr / br:6.2f}x (cpu {fc / bc:6.2f}x)")
        shown.update((name, base))
for name in sorted(set(medians) - shown):
    print(f"  {name:45s} {show(medians[name][0]):>12s}")
PY
