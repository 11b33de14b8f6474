#!/usr/bin/env bash
# The disk-usage walk against `du -sxB1` over the same warm trees, each run in
# a process of its own and timed the same way, alternating, in one run. The
# trees hold regular files of mixed sizes, hard links (one entry in ten) and
# symbolic links to a large file outside the tree (one in twenty), 100
# entries per directory. The walk counts files only; du also counts every
# directory's own blocks, so those (find -type d, %b) are taken off du's
# total before the two are required to be equal. Peak RSS is each process's
# own, from GNU time (%M) in runs of their own: a child started straight from
# this script would inherit the script's high-water mark through fork. Writes bench/results/disk-usage-<stamp>/ (results.csv and
# time.png) and prints the figures as ratios to du's.
#
#   bench/disk_usage.sh                       # trees of 10,000, 30,000 and 100,000 files
#   SIZES="100000 1000000" bench/disk_usage.sh
#   BUILD_DIR=build/release bench/disk_usage.sh   # reuse a configured release build
set -euo pipefail
here="$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)"
source_dir="$(dirname "$here")"
build_dir="${BUILD_DIR:-$source_dir/build/bench}"
sizes="${SIZES:-10000 30000 100000}"
repetitions="${REPETITIONS:-7}"

if [[ ! -f "$build_dir/CMakeCache.txt" ]]; then
  cmake -S "$source_dir" -B "$build_dir" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
    -DKESTREL_BUILD_BENCHMARKS=ON -DKESTREL_BUILD_TESTS=OFF >/dev/null
fi
cmake -S "$source_dir" -B "$build_dir" -DKESTREL_BUILD_BENCHMARKS=ON >/dev/null
cmake --build "$build_dir" --target kestrel_disk_usage_walk -j2
walk="$build_dir/bench/kestrel_disk_usage_walk"

work="$(mktemp -d /var/tmp/kestrel-disk-usage.XXXXXX)"
trap 'rm -rf "$work"' EXIT
out="$here/results/disk-usage-$(date -u +%Y%m%dT%H%M%SZ)"
mkdir -p "$out"

python3 - "$walk" "$work" "$out" "$repetitions" $sizes <<'PY'
import os, statistics, subprocess, sys, time

walk, work, out, repetitions = sys.argv[1], sys.argv[2], sys.argv[3], int(sys.argv[4])
sizes = [int(s) for s in sys.argv[5:]]

outside = os.path.join(work, "outside-large")
with open(outside, "wb") as f:
    f.write(b"x" * (8 << 20))

def build(root, files):
    """files entries, 100 per directory, two levels of directories."""
    previous = None
    for i in range(files):
        d = os.path.join(root, "d%03d" % (i // 10000), "e%03d" % ((i // 100) % 100))
        if i % 100 == 0:
            os.makedirs(d, exist_ok=True)
        path = os.path.join(d, "f%07d" % i)
        if i % 10 == 3 and previous:
            os.link(previous, path)
        elif i % 20 == 7:
            os.symlink(outside, path)
        else:
            with open(path, "wb") as f:
                if i % 8 == 0:
                    f.write(b"y" * ((i * 7919) % 40000))
            previous = path

def run(argv):
    """Wall time (s) and standard output of one process."""
    start = time.perf_counter()
    p = subprocess.run(argv, stdout=subprocess.PIPE, text=True)
    elapsed = time.perf_counter() - start
    if p.returncode != 0:
        sys.exit("%s failed with %d" % (argv[0], p.returncode))
    return elapsed, p.stdout

def peak_rss(argv):
    """Peak resident set (KiB) of one run, as GNU time reports it."""
    report = os.path.join(work, "rss")
    subprocess.run(["/usr/bin/time", "-f", "%M", "-o", report] + argv,
                   stdout=subprocess.DEVNULL, check=True)
    with open(report) as f:
        return int(f.read().split()[-1])

rows = []
for files in sizes:
    root = os.path.join(work, "tree-%d" % files)
    os.makedirs(root)
    t = time.perf_counter()
    build(root, files)
    print("tree of %d entries built in %.1f s" % (files, time.perf_counter() - t), flush=True)
    directories = subprocess.run(["find", root, "-xdev", "-type", "d", "-printf", "%b\n"],
                                 capture_output=True, text=True, check=True).stdout.split()
    directory_bytes = sum(int(b) for b in directories) * 512
    du = ["du", "-sxB1", root]
    ours = [walk, root]
    run(du), run(ours)  # warm the caches
    du_times, our_times = [], []
    for _ in range(repetitions):
        e, text = run(du); du_times.append(e)
        du_total = int(text.split()[0])
        e, text = run(ours); our_times.append(e)
        our_total = int(text)
    du_rss = [peak_rss(du) for _ in range(3)]
    our_rss = [peak_rss(ours) for _ in range(3)]
    if du_total - directory_bytes != our_total:
        sys.exit("totals differ for %d entries: du %d - directories %d != walk %d"
                 % (files, du_total, directory_bytes, our_total))
    rows.append((files, statistics.median(du_times), statistics.median(our_times),
                 max(du_rss), max(our_rss), our_total, du_total, directory_bytes))
    subprocess.run(["rm", "-rf", root], check=True)

with open(os.path.join(out, "results.csv"), "w") as f:
    f.write("entries,du_seconds,walk_seconds,du_peak_rss_kib,walk_peak_rss_kib,"
            "walk_bytes,du_bytes,directory_bytes\n")
    for r in rows:
        f.write("%d,%.6f,%.6f,%d,%d,%d,%d,%d\n" % r)

print("%10s %12s %12s %8s %14s %14s %10s" % ("entries", "du ms", "walk ms", "time",
                                               "du peak KiB", "walk peak KiB", "rss"))
for files, du_t, our_t, du_r, our_r, total, du_total, dirs in rows:
    print("%10d %12.1f %12.1f %7.2fx %14d %14d %9.2fx" % (
        files, du_t * 1e3, our_t * 1e3, our_t / du_t, du_r, our_r, our_r / du_r))
print("totals equal (du less directories' own blocks) for every tree")
PY

{
  echo "machine: $(nproc) cores, $(awk '/MemTotal/ {printf "%.0f GiB", $2/1048576}' /proc/meminfo),"\
    "$(uname -r), $(df -T /var/tmp | awk 'NR == 2 {print $2}'), $(date -u +%Y-%m-%d)"
} >"$out/machine.txt"
if command -v gnuplot >/dev/null; then
  gnuplot <<GP
set terminal png size 800,500
set output '$out/time.png'
set datafile separator ','
set key autotitle columnhead top left
set logscale xy
set xlabel 'entries in the tree'
set ylabel 'median wall time (ms), warm cache'
set grid
plot '$out/results.csv' using 1:(\$2*1000) with linespoints lw 2 title 'du -sxB1', \
     '' using 1:(\$3*1000) with linespoints lw 2 title 'disk-usage walk'
GP
fi
echo "results in $out"
