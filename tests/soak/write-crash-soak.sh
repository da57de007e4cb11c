#!/usr/bin/env bash
# The write crash test as a soak run, outside CI: ROUNDS rounds (default
# 300) of writers over several databases killed with SIGKILL at a random
# moment, the server started again on the same root and every acknowledged
# write read back each time; repeated REPEAT times (default 1) with a fresh
# seed each time. The test prints its seed, each round and a summary
# (writes acknowledged, lost, integrity failures, temporary files left).
# KEEP_GOING=1 counts every failing round instead of stopping at the first.
#
#   tests/soak/write-crash-soak.sh [build-dir]      (default: build)
#
# CVDB_CRASH_SEED=N replays the random choices of a run (with REPEAT=1).
set -euo pipefail
cd "$(dirname "$0")/../.."

build=${1:-build}
rounds=${ROUNDS:-300}
repeat=${REPEAT:-1}
test_bin=$build/tests/e2e/write_crash_tests
[[ -x $test_bin ]] || { echo "write-crash-soak: $test_bin is missing (build the tree first)" >&2; exit 2; }

for run in $(seq "$repeat"); do
  echo "== write-crash-soak: run $run of $repeat, $rounds rounds" >&2
  start=$(date +%s)
  CVDB_CRASH_ROUNDS=$rounds CVDB_CRASH_KEEP_GOING=${KEEP_GOING:-} "$test_bin" --gtest_filter='WriteCrash.*'
  echo "== write-crash-soak: run $run passed in $(($(date +%s) - start)) s" >&2
done
