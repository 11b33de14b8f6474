#!/usr/bin/env bash
# Builds the fuzz targets (preset "fuzz": clang, libFuzzer, ASan and UBSan) and
# runs each for a while over a copy of its seed corpus.
#
#   scripts/fuzz.sh [seconds-per-target] [target...]
#
# seconds-per-target defaults to 60; the targets default to every directory of
# fuzz/corpus/. KESTREL_FUZZ_RUNS=N stops each target after N inputs as well.
# Each target has a default -max_len (below; KESTREL_FUZZ_MAX_LEN=N overrides
# it for every target).
# The corpora grow in build/fuzz/work/<target>/corpus (fuzz/corpus is never
# written); a crash, leak, timeout or sanitizer report leaves its input in
# build/fuzz/work/<target>/artifacts/ and makes the script exit 1.
set -euo pipefail

cd "$(dirname "$0")/.."
repo=$(pwd)

seconds=${1:-60}
[[ $# -gt 0 ]] && shift
if ! [[ "$seconds" =~ ^[0-9]+$ ]]; then
  echo "usage: scripts/fuzz.sh [seconds-per-target] [target...]" >&2
  exit 2
fi

# The toolchain: what every build needs, then clang and its runtimes.
if [[ $(id -u) -eq 0 ]]; then
  scripts/setup.sh </dev/null
  missing=()
  for p in clang libclang-rt-14-dev; do
    status=$(dpkg-query -W -f='${Status}' "$p" 2>/dev/null || true)
    [[ "$status" == "install ok installed" ]] || missing+=("$p")
  done
  if ((${#missing[@]})); then
    echo "fuzz: installing ${missing[*]}"
    export DEBIAN_FRONTEND=noninteractive
    apt-get update -qq </dev/null
    apt-get install -y -qq --no-install-recommends "${missing[@]}" </dev/null >/dev/null
  fi
fi
command -v clang++ >/dev/null || { echo "fuzz: clang++ is missing (run as root to install it)" >&2; exit 1; }

cmake --preset fuzz >/dev/null
cmake --build --preset fuzz --target fuzzers

if [[ $# -gt 0 ]]; then
  targets=("$@")
else
  targets=()
  for dir in fuzz/corpus/*/; do targets+=("$(basename "$dir")"); done
fi

work="$repo/build/fuzz/work"
mkdir -p "$work"
# The fuzzers make their scratch roots beneath this directory; it goes at the end.
scratch_parent=/dev/shm
[[ -d "$scratch_parent" && -w "$scratch_parent" ]] || scratch_parent=${TMPDIR:-/tmp}
export KESTREL_FUZZ_SCRATCH
KESTREL_FUZZ_SCRATCH=$(mktemp -d "$scratch_parent/kestrel-fuzz-run.XXXXXX")
fuzzer=
trap '[[ -n "$fuzzer" ]] && kill "$fuzzer" 2>/dev/null; rm -rf "$KESTREL_FUZZ_SCRATCH"' EXIT
trap 'exit 130' INT TERM

# A 64 MB quarantine still holds far more than one input frees, and ten frames
# of allocation and free stacks are enough to place a report; the defaults
# (256 MB, 30 frames) cost an eighth to a sixth of the time of the targets that
# allocate most.
export ASAN_OPTIONS="detect_leaks=1:abort_on_error=0:allocator_may_return_null=0:quarantine_size_mb=64:malloc_context_size=10"
export UBSAN_OPTIONS="halt_on_error=1:print_stacktrace=1"

# The largest input worth trying: the inputs drawn by FuzzedDataProvider reach
# every shape well below 1 kB (the seeds are under 500 bytes), and longer ones
# only make bigger messages of the same kinds; so do the upcall's packed
# buffers and datagrams (a request is a few identifiers); files and text keep
# libFuzzer's 4 kB.
max_len_for() {
  if [[ -n "${KESTREL_FUZZ_MAX_LEN:-}" ]]; then
    echo "$KESTREL_FUZZ_MAX_LEN"
    return
  fi
  case "$1" in
    fuzz_request_decoding | fuzz_dbus_message_codec | fuzz_path_confinement) echo 1024 ;;
    fuzz_upcall_demux | fuzz_upcall_packbuff) echo 1024 ;;
    *) echo 4096 ;;
  esac
}

# Options of one target. The upcall server keeps what an input makes (the
# cache's entry of a new container): libFuzzer would take that for a leak and
# scan the heap after every such input, six times the cost of the input.
# Leaks are still reported when the run ends.
extra_args_for() {
  case "$1" in
    fuzz_upcall_demux) echo -detect_leaks=0 ;;
  esac
}

failed=()
for target in "${targets[@]}"; do
  binary="$repo/build/fuzz/fuzz/$target"
  if [[ ! -x "$binary" || ! -d "fuzz/corpus/$target" ]]; then
    echo "fuzz: unknown target $target" >&2
    failed+=("$target")
    continue
  fi
  dir="$work/$target"
  rm -rf "$dir/artifacts"
  mkdir -p "$dir/corpus" "$dir/artifacts"
  cp -f "fuzz/corpus/$target"/* "$dir/corpus/"
  args=(-max_total_time="$seconds" -rss_limit_mb=2048 -timeout=30 -print_final_stats=1
        -max_len="$(max_len_for "$target")" -artifact_prefix="$dir/artifacts/")
  [[ -n "${KESTREL_FUZZ_RUNS:-}" ]] && args+=(-runs="$KESTREL_FUZZ_RUNS")
  read -r -a extra <<<"$(extra_args_for "$target")"
  args+=("${extra[@]}")
  echo "fuzz: $target for ${seconds}s"
  start=$(date +%s)
  set +e
  # Where the kernel groups tasks by session (autogroup), nice only ranks tasks
  # within their own session: the fuzzer gets a session of its own whose group
  # is niced, so that builds and benchmarks beside it keep their share. Being
  # in another session it misses a terminal's Ctrl-C; the traps stop it.
  (cd "$dir" && exec setsid -w bash -c 'echo 19 >/proc/self/autogroup 2>/dev/null; exec nice -n 19 "$@"' \
    fuzz "$binary" "${args[@]}" "$dir/corpus" </dev/null >"$dir/log" 2>&1) &
  fuzzer=$!
  wait "$fuzzer"
  rc=$?
  fuzzer=
  set -e
  elapsed=$(($(date +%s) - start))
  runs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$dir/log" | tail -1)
  rate=$(sed -n 's/^stat::average_exec_per_sec: *//p' "$dir/log" | tail -1)
  if [[ $rc -ne 0 ]] || compgen -G "$dir/artifacts/*" >/dev/null; then
    echo "fuzz: $target FAILED (exit $rc) after ${elapsed}s; input(s) in $dir/artifacts/:"
    ls "$dir/artifacts/"
    grep -E -A40 "==ERROR|ERROR: libFuzzer|runtime error|==kestrel-fuzz==|Assertion" "$dir/log" | head -60 || true
    failed+=("$target")
  else
    echo "fuzz: $target ok: ${runs:-?} runs in ${elapsed}s (${rate:-?} exec/s)"
  fi
done

if ((${#failed[@]})); then
  echo "fuzz: failed: ${failed[*]}"
  exit 1
fi
echo "fuzz: all ${#targets[@]} targets ran clean"
