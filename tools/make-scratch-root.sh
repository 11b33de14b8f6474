#!/usr/bin/env bash
# Makes a fresh root directory for the daemon, seeded with the accounts it
# expects and the directories of tools/scratch-root/directories, and prints
# its path. Usage: tools/make-scratch-root.sh [DIR]
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
root=${1:-$(mktemp -d /tmp/kestrel-root.XXXXXX)}
chmod 0755 "$root"
mkdir -p "$root/etc"
cp "$here/scratch-root/etc/passwd" "$here/scratch-root/etc/group" "$root/etc/"
while read -r path mode owner; do
  [[ -z $path || $path == \#* ]] && continue
  mkdir -p "$root$path"
  chmod "$mode" "$root$path"
  chown "$owner:$owner" "$root$path"
done <"$here/scratch-root/directories"
echo "$root"
