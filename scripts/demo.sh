#!/usr/bin/env bash
# Installs what is missing, builds vorbel_host with the component and its
# sibling libraries, and runs a demo under Wine: first one process with one
# bus; then two processes joined by a named pipe that learn each other's
# listeners, and a third process, signed by another signer, that the pipe
# refuses.
# BUILD_DIR selects the build tree (default: build/).
set -euo pipefail
source "$(dirname "$0")/common.sh"

DEMO_DIR="$BUILD_DIR/demo"
HOST="$BUILD_DIR/bin/vorbel_host.exe"
# The same program signed by another signer (built for the tests).
OTHER_HOST="$BUILD_DIR/tests/bin/e2e_hosts/host_b.exe"

# The demo needs the host and the DLLs it loads, not the tests: build that
# target only (it depends on vorbel, parlo, scribo and parlo_ipc).
build_host() {
  echo "== configure and build vorbel_host in $BUILD_DIR"
  cmake -S "$ROOT" -B "$BUILD_DIR" -G Ninja \
    -DCMAKE_TOOLCHAIN_FILE="$ROOT/cmake/mingw-w64.cmake" >/dev/null
  cmake --build "$BUILD_DIR" --target vorbel_host e2e_host_a e2e_host_b
}

# The Windows path of a file of this machine (Wine maps / to Z:).
win_path() {
  printf 'Z:%s' "${1//\//\\}"
}

# run_host LABEL CONFIG LOG [vorbel_host arguments...]: one host process;
# its lines are prefixed with LABEL so that several hosts stay readable.
run_host() {
  run_image "$HOST" "$@"
}

# run_image EXE LABEL CONFIG LOG [arguments...]: as run_host, another program.
run_image() {
  local image=$1 label=$2 config=$3 log=$4
  shift 4
  : >"$log"
  "$WINE" "$image" --config "$(win_path "$config")" --log "$(win_path "$log")" --echo "$@" \
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

demo_two_processes() {
  echo
  echo "== two processes: 'server' exports alerts on a pipe, 'client' imports it"
  local pipe='\\\\.\\PIPE\\vorbel_demo'
  local server="$DEMO_DIR/server.json" client="$DEMO_DIR/client.json"
  cat >"$server" <<EOF
{
  "bus": "main",
  "local_channels": ["alerts"],
  "exported_channels": [{"channel": "alerts", "pipe": "$pipe", "security": 0}]
}
EOF
  cat >"$client" <<EOF
{
  "bus": "main",
  "local_channels": ["alerts"],
  "imported_channels": [{"channel": "alerts", "pipe": "$pipe", "security": 0,
                         "remote_channel": "alerts", "remote_bus": "main"}]
}
EOF
  echo "   server: $server"
  echo "   client: $client"
  # The server stays up until the client has come and gone, then a little
  # longer for the peer of another signer.
  run_host server "$server" "$DEMO_DIR/server.log" \
    --exec "register alerts server-1" \
    --exec "wait-for alerts client-1 any 30000" \
    --exec "wait-for-absent alerts client-1 any 30000" \
    --exec "sleep 4000" \
    --exec "list" \
    --exec "connections" &
  local server_job=$!
  sleep 1
  run_host client "$client" "$DEMO_DIR/client.log" \
    --exec "register alerts client-1" \
    --exec "wait-for alerts server-1 any 15000" \
    --exec "list" \
    --exec "connections" \
    --exec "echo -- client-1 goes away" \
    --exec "unregister alerts client-1" \
    --exec "sleep 500"

  echo
  echo "== a third process, signed by another signer, tries the same pipe (security 0)"
  run_image "$OTHER_HOST" other "$client" "$DEMO_DIR/other.log" \
    --exec "register alerts other-1" \
    --exec "sleep 2000" \
    --exec "list" || true
  wait "$server_job" || true
  echo
  echo "== the server's log on the refused peer ($DEMO_DIR/server.log):"
  grep -E 'DENY|found it in cache' "$DEMO_DIR/server.log" | sed 's/^/   /' | head -5 || true
  show_log server "$DEMO_DIR/server.log"
}

install_missing
build_host
start_wine
mkdir -p "$DEMO_DIR"

demo_single_process
demo_two_processes

echo
echo "== done"
