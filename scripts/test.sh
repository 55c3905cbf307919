#!/usr/bin/env bash
# Installs what is missing, builds vorbel and runs every test under Wine.
# BUILD_DIR selects the build tree (default: build/).
set -euo pipefail
source "$(dirname "$0")/common.sh"

install_missing
configure_and_build
start_wine

echo "== tests"
start=$(date +%s.%N)
rc=0
ctest --test-dir "$BUILD_DIR" --output-on-failure -j2 || rc=$?
end=$(date +%s.%N)
awk -v s="$start" -v e="$end" 'BEGIN { printf "== test run wall time: %.1f s\n", e - s }'

# A short fuzz run of the byte decoders (native clang build beside this one,
# ~10 s a target; fuzz.sh installs clang-14 and its runtimes when missing);
# a crash fails the run and its input stays under <build dir>-fuzz/artifacts/.
echo "== fuzz smoke run"
FUZZ_BUILD_DIR="${FUZZ_BUILD_DIR:-$BUILD_DIR-fuzz}" "$ROOT/scripts/fuzz.sh" 10 || rc=1
exit "$rc"
