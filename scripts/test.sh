#!/usr/bin/env bash
# Builds kestreld and runs its test suite. Usage:
#   scripts/test.sh                 the whole suite, release build
#   scripts/test.sh asan            the whole suite under ASan+UBSan
#   scripts/test.sh tsan -R Concurrency   the concurrency tests under TSan
# Extra arguments go to ctest (e.g. -R StartupTest to run one group).
set -euo pipefail
cd "$(dirname "$0")/.."
preset=${1:-release}
shift || true
scripts/setup.sh
cmake --preset "$preset" >/dev/null
cmake --build --preset "$preset"
ctest --preset "$preset" "$@"
