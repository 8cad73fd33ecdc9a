#!/usr/bin/env bash
# Builds the benchmarks of the release preset and runs every one of them; each
# row is reported as mean, median and spread over several repetitions.
#
#   bash scripts/bench.sh [extra Google Benchmark flags, e.g. --benchmark_filter=Load]
#
# BENCH_REPETITIONS (default 5) sets the repetitions. TC_BENCH_BUILD_DIR builds
# and runs in another directory than the preset's build/release.
# Exits non-zero when a build or any benchmark fails.
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/install-deps.sh

reps=${BENCH_REPETITIONS:-5}
jobs=$(nproc 2>/dev/null || echo 2)
if [ -n "${TC_BENCH_BUILD_DIR:-}" ]; then
  build=$TC_BENCH_BUILD_DIR
  cmake --preset release -B "$build"
  cmake --build "$build" -j "$jobs" --target bench
else
  build=build/release
  cmake --preset release
  cmake --build --preset release -j "$jobs" --target bench
fi

# The figures mean little without the machine they come from.
echo "machine: $(nproc) CPUs,$(grep -m1 'model name' /proc/cpuinfo | cut -d: -f2-)," \
     "load average $(cut -d' ' -f1-3 /proc/loadavg)"

status=0
found=0
for bin in "$build"/bin/*_bench; do
  [ -x "$bin" ] || continue
  found=1
  echo "== $(basename "$bin")"
  "$bin" --benchmark_repetitions="$reps" --benchmark_report_aggregates_only=true "$@" || status=1
done
if [ "$found" -eq 0 ]; then
  echo "no benchmark programs in $build/bin" >&2
  exit 1
fi
exit "$status"
