#!/usr/bin/env bash
# Removes a root made by make-scratch-root.sh together with the named
# semaphores a daemon made for it: those live in /dev/shm, outside the root,
# and would otherwise stay until the next boot. Usage:
#   tools/remove-scratch-root.sh DIR
set -euo pipefail
[[ $# -eq 1 && -n "$1" ]] || { echo "usage: tools/remove-scratch-root.sh DIR" >&2; exit 2; }
root=$1
while [[ ${#root} -gt 1 && $root == */ ]]; do root=${root%/}; done
[[ $root != / ]] || { echo "remove-scratch-root: refusing to remove /" >&2; exit 2; }

# The daemon gives the semaphores of a root other than / the suffix
# ".<FNV-1a 64 of the root's path, 16 hex digits>".
fnv1a64() {
  local LC_ALL=C text=$1 hash=$((0xcbf29ce484222325)) i c
  for ((i = 0; i < ${#text}; i++)); do
    printf -v c '%d' "'${text:i:1}"
    hash=$(((hash ^ (c & 0xff)) * 0x100000001b3))
  done
  printf '%016x' "$hash"
}
suffix=$(fnv1a64 "$root")
rm -f /dev/shm/sem.*."$suffix"
rm -rf "$root"
