#!/usr/bin/env bash
# Installs what is missing, builds vorbel_host with the component and its
# sibling libraries, and runs a demo under Wine: one process, one bus,
# listeners registered and unregistered, every notification printed.
# BUILD_DIR selects the build tree (default: build/).
set -euo pipefail
source "$(dirname "$0")/common.sh"

DEMO_DIR="$BUILD_DIR/demo"
WINE=/usr/lib/wine/wine64
HOST="$BUILD_DIR/bin/vorbel_host.exe"

# The demo needs the host and the DLLs it loads, not the tests: build that
# target only (it depends on vorbel, parlo, scribo and parlo_ipc).
build_host() {
  echo "== configure and build vorbel_host in $BUILD_DIR"
  cmake -S "$ROOT" -B "$BUILD_DIR" -G Ninja \
    -DCMAKE_TOOLCHAIN_FILE="$ROOT/cmake/mingw-w64.cmake" >/dev/null
  cmake --build "$BUILD_DIR" --target vorbel_host
}

# The Windows path of a file of this machine (Wine maps / to Z:).
win_path() {
  printf 'Z:%s' "${1//\//\\}"
}

# run_host LABEL CONFIG LOG [vorbel_host arguments...]: one host process;
# its lines are prefixed with LABEL so that several hosts stay readable.
run_host() {
  local label=$1 config=$2 log=$3
  shift 3
  : >"$log"
  "$WINE" "$HOST" --config "$(win_path "$config")" --log "$(win_path "$log")" --echo "$@" \
    2>&1 | sed -u "s/^/[$label] /"
  return "${PIPESTATUS[0]}"
}

# show_log LABEL LOG: where the component's lines went, and the
# notifications it logged.
show_log() {
  local label=$1 log=$2
  echo "== $label: the component's log is $log ($(wc -l <"$log") lines); its notifications:"
  grep -E 'notify_(new_listener|listener_removed)' "$log" | sed 's/^/   /' || true
}

demo_single_process() {
  echo
  echo "== single process: one bus, listeners registered and unregistered"
  local config="$DEMO_DIR/single.json" log="$DEMO_DIR/single.log"
  cat >"$config" <<'EOF'
{
  "bus": "main",
  "default": true,
  "local_channels": ["alerts", "updates"]
}
EOF
  echo "   configuration: $config"
  # Each wait orders the asynchronous notification before the next command.
  run_host host "$config" "$log" \
    --exec "echo -- two listeners on alerts, one on updates" \
    --exec "register alerts scanner-1" \
    --exec "wait-for alerts scanner-1 self 5000" \
    --exec "register alerts scanner-2" \
    --exec "wait-for alerts scanner-2 self 5000" \
    --exec "register updates updater" \
    --exec "wait-for updates updater self 5000" \
    --exec "list" \
    --exec "registered alerts scanner-1" \
    --exec "echo -- scanner-1 goes away" \
    --exec "unregister alerts scanner-1" \
    --exec "wait-for-absent alerts scanner-1 self 5000" \
    --exec "registered alerts scanner-1" \
    --exec "list" \
    --exec "connections"
  show_log host "$log"
}

install_missing
build_host
start_wine
mkdir -p "$DEMO_DIR"

demo_single_process

echo
echo "== done"
