#!/bin/bash
# Builds the fuzz targets (preset "fuzz": clang, libFuzzer, ASan+UBSan) and
# runs each one briefly on its seed corpus and dictionary, as many at once
# as there are cores.  Any crash, sanitizer report or property violation
# fails the run; the input that caused it is kept in build/fuzz/findings/.
# Scratch corpora live in a temporary directory: the seeds in fuzz/corpus/
# are not changed.
#   fuzz/run-short.sh [seconds per target, default 30]
set -euo pipefail
cd "$(dirname "$0")/.."
seconds=${1:-30}
scripts/deps.sh

targets=()
for dir in fuzz/corpus/*/; do
  targets+=("$(basename "$dir")")
done

echo "=== fuzz: build" >&2
cmake --preset fuzz -DOXIDM_WERROR=ON >/dev/null
cmake --build --preset fuzz -j "$(nproc)" --target "${targets[@]}"

work=$(mktemp -d)
trap 'rm -rf "$work"' EXIT
findings=build/fuzz/findings

run_target() {  # target
  local t=$1
  mkdir -p "$work/$t"
  if build/fuzz/fuzz/"$t" -dict="fuzz/$t.dict" -max_total_time="$seconds" -print_final_stats=1 \
      -artifact_prefix="$work/$t-" "$work/$t" "fuzz/corpus/$t" >"$work/$t.log" 2>&1; then
    echo ok >"$work/$t.status"
  else
    echo failed >"$work/$t.status"
  fi
}

echo "=== fuzz: ${seconds}s per target" >&2
jobs=$(nproc)
running=0
for t in "${targets[@]}"; do
  run_target "$t" &
  running=$((running + 1))
  if ((running >= jobs)); then
    wait -n || true
    running=$((running - 1))
  fi
done
wait

status=0
for t in "${targets[@]}"; do
  execs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$work/$t.log")
  if [[ $(cat "$work/$t.status") == ok ]]; then
    printf '%-18s ok      %12s executions\n' "$t" "${execs:-?}"
  else
    status=1
    printf '%-18s FAILED  %12s executions\n' "$t" "${execs:-?}"
    mkdir -p "$findings"
    cp "$work/$t"-* "$findings"/ 2>/dev/null || true
    grep -E 'property violated|ERROR|SUMMARY|runtime error' "$work/$t.log" | head -20 >&2 || tail -40 "$work/$t.log" >&2
  fi
done
if ((status != 0)); then echo "inputs kept in $findings" >&2; fi
exit $status
