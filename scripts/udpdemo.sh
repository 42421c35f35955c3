# The UDP echo test part of the demo, sourced by scripts/run (which sets WR, BIN and work and
# runs the service under the control manager). The service fetches its test policy from a
# local TLS policy service with the device certificate, and on a backlight change starts the
# test application against a loopback echo relay. udpdemo_put_back leaves the prefix as it
# was found: the test CA out of "Root", the device certificate out of "MY", the role, the
# policy file, the Wi-Fi stand-in and the demo's result file as they were.

UDPDEMO_POLICY_PORT=47340
UDPDEMO_RELAY_PORT=47341
UDPDEMO_ROLE=NetworkConfigWebRole
UDPDEMO_ROLE_KEY='HKLM\Software\Telvane\StandIns\EndpointDirectory'
UDPDEMO_DIR="$WINEPREFIX/drive_c/data/shareddata/zoriviroruz"
udpdemo_ready=""

udpdemo_ctl() { "$WR" "$BIN/telvanectl.exe" "$@" </dev/null; }
udpdemo_winpath() { local p=$1; printf 'Z:%s' "${p//\//\\}"; }

# Before the service starts: remember what the demo changes, and leave the backlight at 1 so
# that the service's subscription, which delivers the current value at once, does nothing.
udpdemo_prepare() {
  udpdemo_old_role=$("$WR" reg query "$UDPDEMO_ROLE_KEY" /v "$UDPDEMO_ROLE" 2>/dev/null </dev/null |
    tr -d '\r' | awk -v n="$UDPDEMO_ROLE" '$1 == n { print $3 }' || true)
  udpdemo_had_policy=""
  if [ -f "$UDPDEMO_DIR/config.json" ]; then
    udpdemo_had_policy=1
    cp "$UDPDEMO_DIR/config.json" "$work/config.json.saved"
  fi
  mkdir -p "$UDPDEMO_DIR/results"
  ls "$UDPDEMO_DIR/results" >"$work/results.before" 2>/dev/null || true
  telvane_install_udptest
  udpdemo_ctl platform backlight 1 >/dev/null
  udpdemo_ready=1
}

udpdemo_run() {
  local pki="$work/pki"
  telvane_log "UDP test: certificates, the policy service on port $UDPDEMO_POLICY_PORT, a relay on $UDPDEMO_RELAY_PORT"
  tests/https/makepki.sh "$pki" >/dev/null
  udpdemo_ctl platform cert root add "$(udpdemo_winpath "$pki/ca.pem")" >/dev/null
  udpdemo_ctl platform cert import "$(udpdemo_winpath "$pki/device.pfx")" telvane >/dev/null
  udpdemo_ctl platform cert provision ok >/dev/null
  local body="{\"Enabled\":\"true\",\"RelayFQDN\":\"127.0.0.1\",\"RelayPort\":$UDPDEMO_RELAY_PORT,"
  body+="\"NumPackets\":20,\"MaxTestDay\":24,\"Policy\":\"BattAC\",\"DurationValid\":\"P1D\"}"
  python3 tests/https/policyserver.py --port "$UDPDEMO_POLICY_PORT" --cert "$pki/server.pem" \
    --key "$pki/server.key" --client-ca "$pki/ca.pem" --body "$body" --requests 1 \
    --lifetime 60 --ready "$work/policy.ready" --log "$work/policy.log" &
  "$WR" "$BIN/udprelay.exe" -port "$UDPDEMO_RELAY_PORT" -packets 20 -lifetime 60 -idle 30 \
    -report "$(udpdemo_winpath "$work/relay.txt")" >/dev/null 2>&1 </dev/null &
  for _ in $(seq 300); do
    [ -f "$work/policy.ready" ] && break
    sleep 0.1
  done

  telvane_log "UDP test: the role points at the policy service; Wi-Fi connected, mains power"
  udpdemo_ctl platform endpoint "$UDPDEMO_ROLE" "https://localhost:$UDPDEMO_POLICY_PORT/"
  udpdemo_ctl platform wifi connected 127.0.0.1
  udpdemo_ctl platform power 0
  rm -f "$UDPDEMO_DIR/config.json" # no policy yet: the first change fetches it

  telvane_log "UDP test: the backlight changes"
  udpdemo_ctl platform backlight 0
  local result=""
  for _ in $(seq 600); do
    result=$(ls "$UDPDEMO_DIR/results" 2>/dev/null | grep -vxF -f "$work/results.before" | head -1 || true)
    [ -n "$result" ] && break
    sleep 0.1
  done
  udpdemo_ctl platform backlight 1 >/dev/null
  telvane_log "UDP test: what the policy service saw"
  cat "$work/policy.log" 2>/dev/null || true
  telvane_log "UDP test: the policy file the service saved"
  cat "$UDPDEMO_DIR/config.json" 2>/dev/null && echo
  telvane_log "UDP test: what the service started"
  udpdemo_ctl platform chamber last
  if [ -z "$result" ]; then
    telvane_log "UDP test: no result file came"
    return 1
  fi
  sleep 1 # the application writes its result as it ends
  telvane_log "UDP test: the test's result ($result)"
  cat "$UDPDEMO_DIR/results/$result" && echo
  [ -f "$work/relay.txt" ] && cat "$work/relay.txt"
  return 0
}

udpdemo_put_back() {
  [ -n "$udpdemo_ready" ] || return 0
  udpdemo_ctl platform backlight 1 >/dev/null 2>&1
  udpdemo_ctl platform wifi disconnected >/dev/null 2>&1
  udpdemo_ctl platform cert remove >/dev/null 2>&1
  [ -f "$work/pki/ca.pem" ] &&
    udpdemo_ctl platform cert root remove "$(udpdemo_winpath "$work/pki/ca.pem")" >/dev/null 2>&1
  if [ -n "$udpdemo_old_role" ]; then
    udpdemo_ctl platform endpoint "$UDPDEMO_ROLE" "$udpdemo_old_role" >/dev/null 2>&1
  else
    udpdemo_ctl platform endpoint "$UDPDEMO_ROLE" --remove >/dev/null 2>&1
  fi
  if [ -n "$udpdemo_had_policy" ]; then
    cp "$work/config.json.saved" "$UDPDEMO_DIR/config.json"
  else
    rm -f "$UDPDEMO_DIR/config.json"
  fi
  ls "$UDPDEMO_DIR/results" 2>/dev/null | grep -vxF -f "$work/results.before" |
    while read -r f; do rm -f "$UDPDEMO_DIR/results/$f"; done
  true
}
