#!/usr/bin/env bash
# Removes a root made by make-scratch-root.sh together with the first-boot
# mark a daemon made for it: a named semaphore in /dev/shm, outside the root,
# that would otherwise stay until the next boot. kestrelctl (built by any of
# the scripts; $KESTRELCTL names another) knows the mark's name. Usage:
#   tools/remove-scratch-root.sh DIR
set -euo pipefail
[[ $# -eq 1 && -n "$1" ]] || { echo "usage: tools/remove-scratch-root.sh DIR" >&2; exit 2; }
root=$1
while [[ ${#root} -gt 1 && $root == */ ]]; do root=${root%/}; done
[[ $root != / ]] || { echo "remove-scratch-root: refusing to remove /" >&2; exit 2; }

repo=$(cd "$(dirname "$0")/.." && pwd)
kestrelctl=${KESTRELCTL:-}
if [[ -z $kestrelctl ]]; then
  for preset in release debug asan tsan; do
    if [[ -x $repo/build/$preset/tools/kestrelctl ]]; then
      kestrelctl=$repo/build/$preset/tools/kestrelctl
      break
    fi
  done
fi
if [[ -n $kestrelctl ]]; then
  "$kestrelctl" --root "$root" reset-first-boot >/dev/null
else
  echo "remove-scratch-root: no kestrelctl built; its first-boot semaphore (/dev/shm/sem.kestreld.fb_check.*) stays" >&2
fi
rm -rf "$root"
