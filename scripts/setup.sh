#!/usr/bin/env bash
# Installs what building and testing kestreld needs on Debian 12, as root.
# Idempotent and quiet when everything is present already.
set -euo pipefail
packages=(
  cmake ninja-build g++ pkg-config ccache
  libsystemd-dev libplist-dev libspdlog-dev libfmt-dev libacl1-dev libattr1-dev uuid-dev
  libcli11-dev nlohmann-json3-dev scdoc
  googletest libgtest-dev libgmock-dev libbenchmark-dev
  acl systemd strace util-linux bubblewrap
)
missing=()
for p in "${packages[@]}"; do
  status=$(dpkg-query -W -f='${Status}' "$p" 2>/dev/null || true)
  [[ "$status" == "install ok installed" ]] || missing+=("$p")
done
if ((${#missing[@]})); then
  echo "setup: installing ${missing[*]}"
  export DEBIAN_FRONTEND=noninteractive
  apt-get update -qq
  apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
fi
