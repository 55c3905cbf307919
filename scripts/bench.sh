#!/usr/bin/env bash
# Benchmarks of vorbel against the raw transport, under Wine; writes
# docs/benchmarks.md (the tables) and docs/benchmarks.png (the growth
# curves).
#
#   scripts/bench.sh            # every benchmark
#   scripts/bench.sh admission-events   # only section 7, written into its
#                                       # own section of docs/benchmarks.md
#   BUILD_DIR=build-x scripts/bench.sh
#
# Installs what is missing (the build's packages, g++ and gnuplot), builds
# vorbel_bench and its sibling DLLs in BUILD_DIR (default build/) and the
# native codec benchmark in BUILD_DIR/bench-native, then runs each
# subcommand with a time limit of its own. Timing runs set
# SCRIBO_LOG_LEVEL=off; the propagation benchmark runs once more with every
# log line written. Raw outputs, logs and plot data stay in
# BUILD_DIR/bench-run. Every timing is reported beside a baseline measured
# in the same run: the machines are shared and absolute times drift.
set -euo pipefail
source "$(dirname "$0")/common.sh"

RUN_DIR="$BUILD_DIR/bench-run"
NATIVE_DIR="$BUILD_DIR/bench-native"
DOC="$ROOT/docs/benchmarks.md"
PLOT="$ROOT/docs/benchmarks.png"

# The Windows path of a file of this machine (Wine maps / to Z:).
win_path() {
  printf 'Z:%s' "${1//\//\\}"
}

build() {
  echo "== configure and build vorbel_bench in $BUILD_DIR"
  cmake -S "$ROOT" -B "$BUILD_DIR" -G Ninja \
    -DCMAKE_TOOLCHAIN_FILE="$ROOT/cmake/mingw-w64.cmake" >/dev/null
  cmake --build "$BUILD_DIR" --target vorbel_bench
  echo "== native codec benchmark in $NATIVE_DIR"
  cmake -S "$ROOT/bench/native" -B "$NATIVE_DIR" -G Ninja >/dev/null
  cmake --build "$NATIVE_DIR"
}

# run NAME SECONDS SUBCOMMAND...: one subcommand under Wine; its markdown
# goes to NAME.md, its standard error to NAME.err. A failure or a timeout
# becomes a line in the section instead of stopping the run.
run() {
  local name=$1 limit=$2
  shift 2
  echo "== $name: vorbel_bench $* (at most ${limit} s)"
  local started=$SECONDS rc=0
  (cd "$RUN_DIR" && timeout "$limit" "$WINE" "$RUN_DIR/../bin/vorbel_bench.exe" "$@" \
    >"$RUN_DIR/$name.md" 2>"$RUN_DIR/$name.err") || rc=$?
  # The program's standard output is in text mode: lines end in CR LF.
  sed -i 's/\r$//' "$RUN_DIR/$name.md"
  if [ $rc -ne 0 ]; then
    printf '\n**%s did not complete** (exit code %s%s); see %s.\n\n' "$name" "$rc" \
      "$([ $rc -eq 124 ] && echo ", stopped after $limit s")" "$name.err" >>"$RUN_DIR/$name.md"
  fi
  if grep -q 'Unhandled exception\|Unhandled page fault' "$RUN_DIR/$name.err"; then
    printf '\n**A process crashed during %s**; see %s.\n\n' "$name" "$name.err" >>"$RUN_DIR/$name.md"
  fi
  echo "   $((SECONDS - started)) s"
}

# splice_section HEADING NEW DOC: the section of DOC that starts with the
# line HEADING (up to the next "## " heading) becomes the text of file NEW;
# without such a section NEW goes before the hand-written notes.
splice_section() {
  awk -v heading="$1" -v new="$2" '
    function emit(  line) { while ((getline line < new) > 0) print line; close(new); done = 1 }
    index($0, heading) == 1 { emit(); skipping = 1; next }
    skipping && /^## / { skipping = 0 }
    !done && !skipping && /^## What limits the missed goals/ { emit() }
    !skipping { print }
  ' "$3" >"$3.new" && mv "$3.new" "$3"
}

# One benchmark on its own: gateway notifications with admission observers.
if [ "${1:-}" = "admission-events" ]; then
  echo "== configure and build vorbel_bench in $BUILD_DIR"
  cmake -S "$ROOT" -B "$BUILD_DIR" -G Ninja -DCMAKE_TOOLCHAIN_FILE="$ROOT/cmake/mingw-w64.cmake" >/dev/null
  cmake --build "$BUILD_DIR" --target vorbel_bench
  start_wine
  RUN_DIR="$BUILD_DIR/bench-run-admission-events"  # the full run's outputs stay
  rm -rf "$RUN_DIR"
  mkdir -p "$RUN_DIR"
  export SCRIBO_LOG_FILE
  SCRIBO_LOG_FILE=$(win_path "$RUN_DIR/component.log")
  export SCRIBO_LOG_LEVEL=off
  load_before=$(cut -d' ' -f1-3 /proc/loadavg)
  run admission-events 300 admission-events
  load_after=$(cut -d' ' -f1-3 /proc/loadavg)
  # The date and load of this run under the section's heading.
  sed -i "1a\\
\\
Run on its own on $(date -u '+%Y-%m-%d %H:%M UTC'): $(nproc) cores, load average $load_before before and $load_after after it, $("$WINE" --version 2>/dev/null || echo Wine); the other sections are from the run at the top." \
    "$RUN_DIR/admission-events.md"
  splice_section "## 7. Gateway notifications with an admission observer" "$RUN_DIR/admission-events.md" "$DOC"
  echo "== wrote section 7 of $DOC"
  exit 0
fi

install_missing g++ gnuplot-nox
build
start_wine
rm -rf "$RUN_DIR"
mkdir -p "$RUN_DIR" "$ROOT/docs"

export SCRIBO_LOG_FILE
SCRIBO_LOG_FILE=$(win_path "$RUN_DIR/component.log")
export SCRIBO_LOG_LEVEL=off
load_before=$(cut -d' ' -f1-3 /proc/loadavg)
run transport 300 transport
run propagation 300 propagation
run convergence 420 convergence 1000 5000 10000 20000
run flood 300 flood
# The same bursts with the machine under load: LOAD_PROCESSES busy loops
# (default 4, twice the cores of the machine these figures come from) share
# the cores with A and B. Each is stopped by its own pid.
load_pids=()
for _ in $(seq "${LOAD_PROCESSES:-4}"); do
  (while :; do :; done) &
  load_pids+=($!)
done
load_during=$(cut -d' ' -f1-3 /proc/loadavg)
run convergence-load 600 convergence --label "under load: ${LOAD_PROCESSES:-4} busy loops beside A and B" \
  1000 5000 10000 20000
kill "${load_pids[@]}"
wait "${load_pids[@]}" 2>/dev/null || true
load_after_burst=$(cut -d' ' -f1-3 /proc/loadavg)
run codec 180 codec
run admission 180 admission
run local 180 local
run admission-events 300 admission-events
SCRIBO_LOG_FILE=$(win_path "$RUN_DIR/propagation-logging.log")
unset SCRIBO_LOG_LEVEL
run propagation-logging 300 propagation
load_after=$(cut -d' ' -f1-3 /proc/loadavg)

echo "== native codec"
"$NATIVE_DIR/codec_bench_native" "$RUN_DIR/codec_native.dat" >"$RUN_DIR/codec-native.md"

echo "== plot"
for f in convergence.dat convergence-load.dat codec_wine.dat codec_native.dat; do
  [ -s "$RUN_DIR/$f" ] || printf '# no data\n1 1 1 1 1\n' >"$RUN_DIR/$f"
done
gnuplot -e "dir='$RUN_DIR'; out='$PLOT'" "$ROOT/bench/plot.gp"

# The goal lines of every section, for the summary at the top.
goals() {
  local f
  for f in transport propagation convergence convergence-load flood codec codec-native admission \
    admission-events local; do
    grep -h '^- .*\(met\|missed\)' "$RUN_DIR/$f.md" 2>/dev/null | sed "s/^- /- $f: /" || true
  done
}

{
  echo "# Benchmarks"
  echo
  echo "Written by \`scripts/bench.sh\` on $(date -u '+%Y-%m-%d %H:%M UTC'): $(nproc) cores, load average" \
    "$load_before before the run and $load_after after it, $("$WINE" --version 2>/dev/null || echo Wine)," \
    "$(x86_64-w64-mingw32-g++-posix -dumpfullversion 2>/dev/null | sed 's/^/mingw-w64 g++ /')," \
    "RelWithDebInfo (-O2). Timing runs set \`SCRIBO_LOG_LEVEL=off\` (the component still formats its" \
    "lines; the logging library drops them). Process A is \`vorbel_bench\`, process B the same program" \
    "started as its peer; both are signed by the build's signer, so B is admitted at pipe level 0."
  echo
  echo "The machine is shared and noisy: compare each timing with the baseline beside it, measured in" \
    "the same run, rather than with another run's absolute numbers."
  echo
  echo "![growth curves](benchmarks.png)"
  echo
  echo "## Goals"
  echo
  goals
  grep -h '^| [0-9]* B |' "$RUN_DIR/transport.md" 2>/dev/null |
    awk -F'|' '{for (i = 2; i <= 12; i++) gsub(/^ +| +$/, "", $i);
      printf "- transport %s: bus p50 / raw p50 = %s (goal <= 1.5): %s; bus p99 %s µs (goal < 2 ms): %s\n", $2, $9, $11, $7, $12}' || true
  echo
  cat "$RUN_DIR/transport.md" "$RUN_DIR/propagation.md"
  echo "### Propagation with every log line written"
  echo
  echo "The same benchmark with \`SCRIBO_LOG_LEVEL\` unset: every line, trace included, goes to a file."
  echo
  sed -n '/^| |/,/^$/p' "$RUN_DIR/propagation-logging.md"
  grep -h '^- \|^\*\*' "$RUN_DIR/propagation-logging.md" || true
  echo
  cat "$RUN_DIR/convergence.md"
  echo "The load average was $load_during when the busy loops had started and $load_after_burst when the run"
  echo "under load ended."
  echo
  cat "$RUN_DIR/convergence-load.md" "$RUN_DIR/flood.md"
  echo "## 4. Codec: the listeners message, per listener"
  echo
  echo "Encode = \`comm::encode_listeners\`, verify = \`comm::verify_listeners\`, decode ="
  echo "\`comm::read_listeners\` (after a successful verify). Each number is the fastest of 60 batches of"
  echo "about 2 ms (the batch no other process disturbed). The goals are judged on the Wine build, which"
  echo "is what ships; the native build shows what the code costs without Wine's heap and C runtime."
  echo
  cat "$RUN_DIR/codec.md"
  echo
  cat "$RUN_DIR/codec-native.md"
  echo
  cat "$RUN_DIR/admission.md" "$RUN_DIR/local.md"
  cat "$RUN_DIR/admission-events.md"
  if [ -f "$ROOT/bench/analysis.md" ]; then
    echo
    cat "$ROOT/bench/analysis.md"
  fi
} >"$DOC"

echo "== wrote $DOC and $PLOT"
