#!/usr/bin/env bash
# The launch benchmark: starts kestreld (release build) on a fresh scratch
# root, then times kestrel-run from its start to the first instruction of a
# program it starts in an app's containers (made by the first launch),
# against bwrap started directly with the same command line, alternating,
# and writes bench/results/launch-<stamp>/result.txt. KESTREL_RUN_ALSO names
# another kestrel-run binary (an earlier build) timed in the same rounds.
#
# The app's user is a local account, as on a system the daemon serves: both
# launches run in a mount namespace of their own whose /etc/passwd and
# /etc/group are the host's plus the scratch root's mobile users. With
# ACCOUNTS=scratch they are the host's alone, and the user's groups come
# from the account database's other sources (NSS).
#
#   bench/launch.sh [rounds]      # default 200 of each
set -euo pipefail
source "$(dirname "${BASH_SOURCE[0]}")/daemon-root.sh"
rounds="${1:-200}"

bench_build kestrel-run kestrel_launch_bench kestrel_launch_stamp
bench_make_root
bench_start_daemon

out="$here/results/launch-$(date -u +%Y%m%dT%H%M%SZ)"
mkdir -p "$out"
in_namespace=()
if [[ "${ACCOUNTS:-local}" == local ]]; then
  accounts="$out/etc"
  mkdir -p "$accounts"
  { cat /etc/passwd; grep -E '^(mobile|mobile2|_systemcontainer):' "$root/etc/passwd"; } >"$accounts/passwd"
  { cat /etc/group; grep -E '^(mobile|mobile2|systemusers):' "$root/etc/group"; } >"$accounts/group"
  in_namespace=(unshare --mount --propagation private sh -c
    'mount --bind "$0/passwd" /etc/passwd && mount --bind "$0/group" /etc/group && exec "$@"'
    "$accounts")
fi
"${in_namespace[@]}" "$build_dir/bench/kestrel_launch_bench" --rounds "$rounds" ${KESTREL_RUN_ALSO:+--also "$KESTREL_RUN_ALSO"} -- \
  "$build_dir/tools/kestrel-run" --root "$root" --identifier com.zorvane.kestrel.bench.app \
  --user 501 --group group.com.zorvane.kestrel.bench -- "$build_dir/bench/kestrel_launch_stamp" |
  tee "$out/result.txt"
echo "machine: $(nproc) cores, $(uname -r), $(date -u +%Y-%m-%d), load $(cut -d' ' -f1-3 /proc/loadavg), accounts ${ACCOUNTS:-local}" |
  tee "$out/machine.txt"
echo "results: $out"
