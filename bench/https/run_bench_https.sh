#!/usr/bin/env bash
# Runs bench_https with the HTTPS tests' certificates in the prefix's stores, and takes them
# out again afterwards. Usage: bench/https/run_bench_https.sh [BUILD_DIR]
set -euo pipefail
root=$(cd "$(dirname "$0")/../.." && pwd)
build=${1:-$root/build}
pki=$build/tests/https/pki
trap 'bash "$root/tests/https/pkifixture.sh" cleanup "$build" >/dev/null' EXIT
bash "$root/tests/https/pkifixture.sh" setup "$build" >/dev/null
# The bench reads its certificates where the tests keep them.
mkdir -p "$build/bench/https"
rm -rf "$build/bench/https/pki"
ln -s "$pki" "$build/bench/https/pki"
"$build/wine-run" "$build/bin/bench_https.exe"
