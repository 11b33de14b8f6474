#!/usr/bin/env bash
# Makes a fresh root directory for the daemon, seeded with the accounts it
# expects, and prints its path. Usage: tools/make-scratch-root.sh [DIR]
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
root=${1:-$(mktemp -d /tmp/kestrel-root.XXXXXX)}
mkdir -p "$root/etc" "$root/private/var/mobile" "$root/private/var/mobile2" "$root/tmp"
chmod 1777 "$root/tmp"  # where death row puts what it cannot remove
chmod 0755 "$root"
cp "$here/scratch-root/etc/passwd" "$here/scratch-root/etc/group" "$root/etc/"
chown 501:501 "$root/private/var/mobile"
chown 502:502 "$root/private/var/mobile2"
echo "$root"
