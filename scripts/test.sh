#!/usr/bin/env bash
# Installs what is missing, then builds and runs the whole test suite twice:
# the release build and the AddressSanitizer + UndefinedBehaviorSanitizer build,
# both with warnings as errors. Exits non-zero on any failure.
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/install-deps.sh

jobs=$(nproc 2>/dev/null || echo 2)
for preset in release asan; do
  echo "== $preset"
  cmake --preset "$preset" -DTC_WERROR=ON
  cmake --build --preset "$preset" -j "$jobs"
  ctest --preset "$preset" -j "$jobs"
done
