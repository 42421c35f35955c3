#!/usr/bin/env bash
# CTest fixture of the HTTPS tests. "setup" makes the test certificates, trusts the test CA
# in the prefix's machine Root store and imports the device certificate (and a client
# certificate without the device usage) into the user's MY store; "cleanup" takes all of
# that out again, so the prefix is left as it was found.
# Usage: pkifixture.sh setup|cleanup BUILD_DIR
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
action=$1
build=$2
pki=$build/tests/https/pki
ctl() { "$build/wine-run" "$build/bin/telvanectl.exe" "$@" </dev/null; }
winpath() { local p=$1; printf 'Z:%s' "${p//\//\\}"; }

case $action in
setup)
  rm -rf "$pki"
  "$here/makepki.sh" "$pki"
  ctl platform cert remove
  ctl platform cert root add "$(winpath "$pki/ca.pem")"
  ctl platform cert import "$(winpath "$pki/device.pfx")" telvane
  ctl platform cert import "$(winpath "$pki/other.pfx")" telvane
  ctl platform cert provision ok
  ;;
cleanup)
  status=0
  ctl platform cert remove || status=1
  if [ -f "$pki/ca.pem" ]; then
    ctl platform cert root remove "$(winpath "$pki/ca.pem")" || status=1
  fi
  ctl platform cert provision ok || status=1
  exit $status
  ;;
*)
  echo "usage: pkifixture.sh setup|cleanup BUILD_DIR" >&2
  exit 2
  ;;
esac
