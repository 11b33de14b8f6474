#!/usr/bin/env bash
# Builds the Debian package kestreld_<version>_<arch>.deb from the release
# build (building it first) and prints its path. Usage: scripts/package.sh
# The package holds what `cmake --install` installs, beneath /usr; see dist/.
set -euo pipefail
cd "$(dirname "$0")/.."
scripts/setup.sh
# dpkg-shlibdeps computes the package's dependencies on shared libraries.
if ! dpkg-query -W -f='${Status}' dpkg-dev 2>/dev/null | grep -q "install ok installed"; then
  DEBIAN_FRONTEND=noninteractive apt-get install -y -qq --no-install-recommends dpkg-dev >/dev/null
fi
cmake --preset release >/dev/null
cmake --build --preset release
rm -f build/release/kestreld_*.deb
(cd build/release && cpack -G DEB >/dev/null)
ls build/release/kestreld_*.deb
