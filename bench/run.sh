#!/bin/bash
# Builds the library and the benchmarks in release mode, runs every family
# (one process each, with repetitions) and prints one table: each figure next
# to its limit or peer measured in the same run, the ratio and the target.
#
# Usage: bench/run.sh [--markdown] [filter-regex]
#   OXIDM_BENCH_BUILD   build directory (default build/release)
#   OXIDM_BENCH_REPS    repetitions per benchmark (default 7), randomly interleaved
#                       within a family; the table takes the least disturbed one
#   OXIDM_BENCH_MIN_TIME  minimum time per repetition in seconds (default 0.1)
# Runs as root: the families enter a private mount namespace so that the
# library's fixed configuration paths are tmpfs mounts of their own.
set -euo pipefail
cd "$(dirname "$0")/.."
markdown=()
if [[ ${1:-} == --markdown ]]; then markdown=(--markdown); shift; fi
filter=${1:-.}
build=${OXIDM_BENCH_BUILD:-build/release}
reps=${OXIDM_BENCH_REPS:-7}
min_time=${OXIDM_BENCH_MIN_TIME:-0.1}

# Tools, Google Benchmark and nss_wrapper (scripts/deps.sh), and the peers
# MIT Kerberos and the grid-mapfile lookup: benchmark-only dependencies.
scripts/deps.sh libkrb5-dev libglobus-gss-assist-dev

cmake --preset release -B "$build" -DOXIDM_TESTS=OFF >/dev/null
cmake --build "$build" --target benchmarks >/dev/null

out=$build/bench-results
rm -rf "$out"
mkdir -p "$out"
for exe in "$build"/bench/bench_*; do
  [[ -x $exe && ! -d $exe ]] || continue
  name=$(basename "$exe")
  echo "running $name" >&2
  # The map file family changes the process's heap settings part way and
  # runs in the order it registers; the others interleave their repetitions.
  interleave=true
  [[ $name == bench_mapfiles ]] && interleave=false
  # The JSON goes to a descriptor opened here: the family writes it from
  # inside its private mount namespace, whose own /tmp (and overlaid /var and
  # /opt) would hide a path of a checkout there.
  "$exe" --benchmark_filter="$filter" --benchmark_repetitions="$reps" --benchmark_min_time="$min_time" \
         --benchmark_enable_random_interleaving=$interleave \
         --benchmark_out=/dev/fd/3 --benchmark_out_format=json 3>"$out/$name.json" >"$out/$name.txt" 2>&1 ||
    echo "  $name failed; see $out/$name.txt" >&2
done
python3 bench/report.py "$out" bench/ratios.txt "${markdown[@]}"
