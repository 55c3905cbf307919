#!/usr/bin/env bash
# Fuzzes the decoders that read bytes from other processes, natively with
# clang 14 and libFuzzer (AddressSanitizer, UndefinedBehaviorSanitizer).
#
#   scripts/fuzz.sh [SECONDS_PER_TARGET] [TARGET...]
#
# Installs clang-14 and libclang-rt-14-dev when missing, builds fuzz/ in
# FUZZ_BUILD_DIR (default build-fuzz), writes the seed corpora from real
# messages, then runs each target (default: all three) for SECONDS_PER_TARGET
# seconds (default 600), one after the other. Prints per target: executions,
# exec/s, crashes, peak RSS and corpus size.
#
# Under FUZZ_BUILD_DIR: seeds/<target>/ (rewritten each run), corpus/<target>/
# (kept and grown from run to run), artifacts/<target>/ (crashing, leaking,
# timing-out and out-of-memory inputs, kept), logs/<target>.log.
# Exits non-zero when a target found a crash (or could not run); replay an
# input with `FUZZ_BUILD_DIR/<target> <input>`.
set -euo pipefail

ROOT=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
FUZZ_BUILD_DIR=${FUZZ_BUILD_DIR:-$ROOT/build-fuzz}
case "$FUZZ_BUILD_DIR" in /*) ;; *) FUZZ_BUILD_DIR=$PWD/$FUZZ_BUILD_DIR ;; esac
SECONDS_PER_TARGET=${1:-600}
shift || true
TARGETS=("$@")
[ ${#TARGETS[@]} -eq 0 ] && TARGETS=(listeners_fuzzer message_codec_fuzzer frame_fuzzer)

case "$SECONDS_PER_TARGET" in
  '' | *[!0-9]*) echo "usage: $0 [SECONDS_PER_TARGET] [TARGET...]" >&2; exit 2 ;;
esac

# The native build needs only the compiler, its runtimes and flatbuffers; not
# the cross toolchain and Wine that common.sh's list brings.
FUZZ_PACKAGES=(cmake ninja-build flatbuffers-compiler libflatbuffers-dev clang-14 libclang-rt-14-dev)
missing=()
for p in "${FUZZ_PACKAGES[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed' || missing+=("$p")
done
if [ ${#missing[@]} -gt 0 ]; then
  echo "== installing: ${missing[*]}"
  sudo=""
  [ "$(id -u)" -ne 0 ] && sudo="sudo"
  export DEBIAN_FRONTEND=noninteractive
  if ! $sudo apt-get install -y -q --no-install-recommends "${missing[@]}" >/dev/null; then
    $sudo apt-get update -q >/dev/null
    $sudo apt-get install -y -q --no-install-recommends "${missing[@]}" >/dev/null
  fi
fi

# One run at a time per tree: a second one would rebuild the binaries, rewrite
# the seeds and write into the same logs and corpus under the first.
mkdir -p "$FUZZ_BUILD_DIR"
exec 9>"$FUZZ_BUILD_DIR/.fuzz.lock"
if ! flock -n 9; then
  echo "== waiting for the fuzz run already using $FUZZ_BUILD_DIR"
  flock 9
fi

echo "== fuzz build in $FUZZ_BUILD_DIR"
CC=clang-14 CXX=clang++-14 cmake -S "$ROOT/fuzz" -B "$FUZZ_BUILD_DIR" -G Ninja >/dev/null
cmake --build "$FUZZ_BUILD_DIR" --target fuzz_seeds "${TARGETS[@]}"

rm -rf "$FUZZ_BUILD_DIR/seeds"
"$FUZZ_BUILD_DIR/fuzz_seeds" "$FUZZ_BUILD_DIR/seeds"

# Seed folder and dictionary of a target.
seeds_of() {
  case "$1" in
    listeners_fuzzer) echo listeners ;;
    message_codec_fuzzer) echo message_codec ;;
    frame_fuzzer) echo frame ;;
    *) echo "unknown fuzz target: $1" >&2; return 1 ;;
  esac
}

# Undefined behaviour must stop the run with a stack, like any other crash.
export UBSAN_OPTIONS=${UBSAN_OPTIONS:-print_stacktrace=1:halt_on_error=1}

# The inputs a run kept in <artifacts> since <stamp> was touched.
new_artifacts() {
  find "$1" -maxdepth 1 -type f -newer "$2" \
    \( -name 'crash-*' -o -name 'leak-*' -o -name 'timeout-*' -o -name 'oom-*' \)
}

stat_of() {  # stat_of <log> <name>: a value of libFuzzer's final statistics
  sed -n "s/^stat::$2:[[:space:]]*\([0-9]*\).*/\1/p" "$1" | tail -n 1
}

failed=0
summary=()
for target in "${TARGETS[@]}"; do
  name=$(seeds_of "$target")
  corpus="$FUZZ_BUILD_DIR/corpus/$target"
  artifacts="$FUZZ_BUILD_DIR/artifacts/$target"
  log="$FUZZ_BUILD_DIR/logs/$target.log"
  mkdir -p "$corpus" "$artifacts" "$(dirname "$log")"
  dict=()
  [ -f "$ROOT/fuzz/dict/$name.dict" ] && dict=("-dict=$ROOT/fuzz/dict/$name.dict")
  stamp="$FUZZ_BUILD_DIR/logs/$target.start"
  touch "$stamp"

  echo "== $target for ${SECONDS_PER_TARGET} s"
  rc=0
  "$FUZZ_BUILD_DIR/$target" -rss_limit_mb=2560 -timeout=25 -max_total_time="$SECONDS_PER_TARGET" \
    -print_final_stats=1 -artifact_prefix="$artifacts/" "${dict[@]}" \
    "$corpus" "$FUZZ_BUILD_DIR/seeds/$name" >"$log" 2>&1 || rc=$?

  crashes=$(new_artifacts "$artifacts" "$stamp" | wc -l)
  executions=$(stat_of "$log" number_of_executed_units)
  per_second=$(stat_of "$log" average_exec_per_sec)
  peak_rss=$(stat_of "$log" peak_rss_mb)
  corpus_files=$(find "$corpus" -type f | wc -l)
  corpus_kb=$(( $(du -sb "$corpus" | cut -f1) / 1024 ))
  summary+=("$(printf '%-22s %12s %8s %8s %10s %8s %9s' "$target" "${executions:-?}" "${per_second:-?}" \
    "$crashes" "${peak_rss:-?} MB" "$corpus_files" "${corpus_kb} KB")")

  if [ "$rc" -ne 0 ] || [ "$crashes" -gt 0 ]; then
    failed=1
    echo "!! $target failed (exit $rc, $crashes new artifact(s)); log: $log"
    grep -E '^(==[0-9]+==ERROR|SUMMARY|.*check failed|.*runtime error)' "$log" | head -n 5 || true
    new_artifacts "$artifacts" "$stamp" | sed 's/^/   kept: /'
  fi
done

echo "== fuzz summary (${SECONDS_PER_TARGET} s per target)"
printf '%-22s %12s %8s %8s %10s %8s %9s\n' target executions exec/s crashes "peak RSS" corpus size
printf '%s\n' "${summary[@]}"
exit "$failed"
