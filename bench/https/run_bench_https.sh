#!/usr/bin/env bash
# Runs bench_https with the HTTPS tests' certificates in the prefix's stores, and takes them
# out again afterwards. Usage: bench/https/run_bench_https.sh [BUILD_DIR]
set -euo pipefail
root=$(cd "$(dirname "$0")/../.." && pwd)
build=${1:-$root/build}
trap 'bash "$root/tests/https/pkifixture.sh" cleanup "$build" >/dev/null' EXIT
bash "$root/tests/https/pkifixture.sh" setup "$build" >/dev/null
"$build/wine-run" "$build/bin/bench_https.exe"
