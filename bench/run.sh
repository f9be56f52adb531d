#!/bin/bash
# Builds the release preset, runs every benchmark program (one process per
# family) and prints one table: each figure next to its limit or peer from the
# same run, with the ratio and the target.  Usage: bench/run.sh [filter-regex]
set -euo pipefail
cd "$(dirname "$0")/.."
missing=()
for p in cmake ninja-build g++ libbenchmark-dev libgtest-dev python3; do
  dpkg -s "$p" >/dev/null 2>&1 || missing+=("$p")
done
if ((${#missing[@]})); then apt-get install -y "${missing[@]}" >/dev/null; fi
cmake --preset release >/dev/null
cmake --build --preset release >/dev/null
out=build/release/bench-results
rm -rf "$out"; mkdir -p "$out"
for exe in build/release/bench/bench_*; do
  [[ -x $exe ]] || continue
  name=$(basename "$exe")
  echo "running $name" >&2
  "$exe" --benchmark_filter="${1:-.}" --benchmark_min_time=0.2 \
         --benchmark_out="$out/$name.json" --benchmark_out_format=json >/dev/null
done
python3 bench/report.py "$out" bench/ratios.txt
