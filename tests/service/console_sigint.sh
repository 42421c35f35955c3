#!/bin/sh
# Console mode of telvanerun.exe ends on SIGINT: Wine turns it into CTRL_C_EVENT for the
# console control handler, the service runs OnStop and the runner exits with 0.
# Usage: console_sigint.sh WINE_RUN TELVANERUN_EXE
set -u
wine_run=$1
runner=$2
out=$(mktemp)
trap 'rm -f "$out"' EXIT

fail() {
  echo "FAIL: $*"
  echo "--- runner output ---"
  cat "$out"
  kill -KILL "$pid" 2>/dev/null
  exit 1
}

# Waits up to 30 s for a condition given as a command.
wait_for() {
  i=0
  while ! "$@"; do
    i=$((i + 1))
    [ $i -le 300 ] || return 1
    sleep 0.1
  done
}

running() { grep -q "Telvane is RUNNING" "$out"; }
gone() { ! kill -0 "$pid" 2>/dev/null; }

TELVANE_TRACE_STDOUT=1 "$wine_run" "$runner" >"$out" 2>&1 </dev/null &
pid=$!
wait_for running || fail "the service never reported RUNNING"
kill -INT "$pid"
wait_for gone || fail "the runner did not exit after SIGINT"
wait "$pid"
rc=$?
[ "$rc" -eq 0 ] || fail "exit code $rc"
grep -q "TelvaneService::OnStop()" "$out" || fail "OnStop did not run"
grep -q "Telvane is STOPPED" "$out" || fail "STOPPED was not reported"
echo "console mode stopped on SIGINT"
