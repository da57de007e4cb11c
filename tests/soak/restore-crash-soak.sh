#!/usr/bin/env bash
# The restore crash test as a soak run, outside CI: ROUNDS rounds (default
# 200) of a restore killed with SIGKILL at a random moment, and as many
# stopped with SIGTERM, the server started again on the same root and every
# database checked each time; repeated REPEAT times (default 1) with a
# fresh seed each time. Each test prints its seed and how every round's
# signal landed; the script stops at the first failing run.
#
#   tests/soak/restore-crash-soak.sh [build-dir]      (default: build)
#
# CVDB_CRASH_SEED=N replays the kill moments of a run (with REPEAT=1).
set -euo pipefail
cd "$(dirname "$0")/../.."

build=${1:-build}
rounds=${ROUNDS:-200}
repeat=${REPEAT:-1}
test_bin=$build/tests/e2e/restore_crash_tests
[[ -x $test_bin ]] || { echo "restore-crash-soak: $test_bin is missing (build the tree first)" >&2; exit 2; }

for run in $(seq "$repeat"); do
  echo "== restore-crash-soak: run $run of $repeat, $rounds rounds" >&2
  start=$(date +%s)
  CVDB_CRASH_ROUNDS=$rounds "$test_bin" --gtest_filter='RestoreCrash.*'
  echo "== restore-crash-soak: run $run passed in $(($(date +%s) - start)) s" >&2
done
