#!/bin/bash
# The long forms of the hardening runs (the test suite runs short ones):
#   fuzz    every fuzz target for FUZZ_SECONDS (default 600), as many at once
#           as there are cores, on a corpus kept in build/fuzz/corpus-long/
#           (seeded from fuzz/corpus/); findings in build/fuzz/findings/
#   stress  the stress test for STRESS_SECONDS (default 600) in the release
#           build (no sanitizer, so that the memory figures mean something):
#           calls per second, resident memory at warm-up, end and peak; the
#           test fails if memory grows after warm-up
#   cancel  the random cancellation tests with CANCEL_ITERATIONS (default
#           2000) cancelled threads each, under ASan+UBSan (leaks included)
#           and under TSan
# Usage: scripts/harden-long.sh [fuzz|stress|cancel|all]   (default all)
set -euo pipefail
cd "$(dirname "$0")/.."
what=${1:-all}
fuzz_seconds=${FUZZ_SECONDS:-600}
stress_seconds=${STRESS_SECONDS:-600}
cancel_iterations=${CANCEL_ITERATIONS:-2000}
jobs=$(nproc)
scripts/deps.sh
status=0

run_fuzz() {
  local targets=() t
  for dir in fuzz/corpus/*/; do targets+=("$(basename "$dir")"); done
  echo "=== fuzz: build" >&2
  cmake --preset fuzz -DOXIDM_WERROR=ON >/dev/null
  cmake --build --preset fuzz -j "$jobs" --target "${targets[@]}"
  local long=build/fuzz/corpus-long findings=build/fuzz/findings
  mkdir -p "$long" "$findings"
  echo "=== fuzz: ${fuzz_seconds}s per target" >&2
  local running=0
  for t in "${targets[@]}"; do
    mkdir -p "$long/$t"
    (
      if build/fuzz/fuzz/"$t" -dict="fuzz/$t.dict" -max_total_time="$fuzz_seconds" -print_final_stats=1 \
          -artifact_prefix="$findings/$t-" "$long/$t" "fuzz/corpus/$t" >"$long/$t.log" 2>&1; then
        echo ok >"$long/$t.status"
      else
        echo failed >"$long/$t.status"
      fi
    ) &
    running=$((running + 1))
    if ((running >= jobs)); then
      wait -n || true
      running=$((running - 1))
    fi
  done
  wait
  for t in "${targets[@]}"; do
    local execs rate cov
    execs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$long/$t.log")
    rate=$(sed -n 's/^stat::average_exec_per_sec: *//p' "$long/$t.log")
    cov=$(grep -o 'cov: [0-9]*' "$long/$t.log" | tail -1)
    printf '%-18s %-7s %12s executions %8s/s  %s  corpus %s\n' "$t" "$(cat "$long/$t.status")" "${execs:-?}" \
      "${rate:-?}" "${cov:-}" "$(ls "$long/$t" | wc -l)"
    [[ $(cat "$long/$t.status") == ok ]] || status=1
  done
}

# Runs each test matching a gtest filter in a process of its own, as ctest does
# (once-controls start fresh), but without ctest's per-test time limit.
run_each() {  # test program, gtest filter
  local program=$1 filter=$2 suite= line
  while IFS= read -r line; do
    if [[ $line != " "* ]]; then suite=${line%% *}; continue; fi
    line=${line#"${line%%[! ]*}"}; line=${line%% *}
    echo "--- $suite$line" >&2
    "$program" --gtest_filter="$suite$line" || status=1
  done < <("$program" --gtest_list_tests --gtest_filter="$filter")
}

run_stress() {
  echo "=== stress: release build" >&2
  cmake --preset release >/dev/null
  cmake --build --preset release -j "$jobs" --target oxidm_concurrency_tests
  echo "=== stress: ${stress_seconds}s" >&2
  OXIDM_STRESS_SECONDS=$stress_seconds run_each build/release/tests/oxidm_concurrency_tests 'Stress.*'
}

run_cancel() {
  local preset
  for preset in asan-ubsan tsan; do
    echo "=== cancel: $preset build" >&2
    cmake --preset "$preset" -DOXIDM_WERROR=ON >/dev/null
    cmake --build --preset "$preset" -j "$jobs" --target oxidm_concurrency_tests
    echo "=== cancel: $preset, $cancel_iterations threads per test" >&2
    OXIDM_CANCEL_ITERATIONS=$cancel_iterations run_each "build/$preset/tests/oxidm_concurrency_tests" 'CancelRandom.*'
  done
}

case $what in
  fuzz) run_fuzz ;;
  stress) run_stress ;;
  cancel) run_cancel ;;
  all) run_fuzz; run_stress; run_cancel ;;
  *) echo "usage: $0 [fuzz|stress|cancel|all]" >&2; exit 2 ;;
esac
exit $status
