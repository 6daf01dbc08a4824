#!/usr/bin/env bash
# The whole chain in a throw-away world: the reference service, the daemon, and a few searches typed at them.
# usage: tools/demo.sh FOLDER-OF-THE-PROGRAMS   (./dev demo builds them first)
set -euo pipefail
export LC_ALL=C.UTF-8

bin=$(cd "${1:?the folder that holds sabled, sablectl and sable-service}" && pwd)
world=$(mktemp -d "${TMPDIR:-/tmp}/sabled-demo.XXXXXX")
programs=()

clean_up() {
  local status=$?
  trap - EXIT INT TERM HUP
  if ((status != 0 && status != 130)); then
    printf '\ndemo: failed; the last lines of the logs:\n'
    tail -n 20 "$world"/*.log || true
  fi >&2
  kill "${programs[@]}" 2>/dev/null || true
  wait "${programs[@]}" 2>/dev/null || true
  rm -rf "$world"
  exit "$status"
}
trap clean_up EXIT
trap 'exit 130' INT TERM HUP

die() { printf 'demo: %s\n' "$*" >&2; exit 1; }
show() { printf '\n$ sablectl %s\n' "$*"; sablectl "$@"; }
sablectl() { "$bin/sablectl" "$@"; }

export SABLED_RUNTIME_DIR=$world/run SABLED_CACHES_DIR=$world/caches SABLED_STATE_DIR=$world/state
export SABLED_CONFIG_DIR=$world/config SABLED_PROFILE=$world/profile.toml
mkdir -m 700 "$world"/{run,caches,state,config}

start_service() {
  local line
  # The index takes some seconds to build, so it stays beside the programs for the next time.
  exec {answers}< <(exec "$bin/sable-service" --data "$bin/../demo-index" 2>"$world/service.log")
  programs+=("$!")
  IFS= read -r -t 120 line <&"$answers" || die "sable-service did not say where it listens"
  [[ $line =~ http://[^[:space:]/]+ ]] || die "sable-service said: $line"
  service=${BASH_REMATCH[0]}
  echo "reference service at $service"
}

write_settings() {
  printf 'SBLDefaultBagURL = "%s/bag"\nSBLDefaultBagURLCN = "%s/bag"\n' "$service" "$service" \
    >"$SABLED_CONFIG_DIR/defaults.toml"
  cat >"$SABLED_CONFIG_DIR/facts.toml" <<'FACTS'
screen_scale = 2.0
locale = "en_GB"
keyboard_input_mode = "en_GB@sw=QWERTY"
preferred_languages = ["en-GB"]
country_code = "GB"
diagnostics_allowed = true
FACTS
}

start_daemon() {
  local pid
  "$bin/sabled" >"$world/sabled.log" 2>&1 &
  pid=$!
  programs+=("$pid")
  until [[ -S $SABLED_RUNTIME_DIR/relay.sock ]]; do
    kill -0 "$pid" 2>/dev/null || die "sabled ended"
    sleep 0.02
  done
  sablectl status >"$world/status.log" 2>&1 || die "sabled does not answer"
  echo "sabled at $SABLED_RUNTIME_DIR/relay.sock"
}

start_service
write_settings
start_daemon

show type "weather"
show explain "weath" --after "wea"
show type "image viewer"
printf '\n$ sablectl bag      (its first lines)\n'
sablectl bag | sed -n '1,12p'
show dump
# The uploads run on their own; the sums of the ledger meet when they have ended.
for ((try = 0; try < 100; ++try)); do
  [[ $(sablectl uploads) == *ended* ]] && sablectl ledger >"$world/ledger.log" && break
  sleep 0.1
done
show uploads
printf '\n$ sablectl ledger      (what is not 0)\n'
sablectl ledger | awk '$2 != 0'
show counters

if [[ -t 0 && -t 1 ]]; then
  printf '\nType a query; an empty line or Ctrl-D ends.\n'
  while IFS= read -e -r -p 'search> ' query && [[ -n $query ]]; do
    sablectl type "$query" || true
  done
fi
