# Shared by the scripts: packages, configure, build, Wine prefix.
# Source it; it sets ROOT and BUILD_DIR.

ROOT=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
BUILD_DIR=${BUILD_DIR:-$ROOT/build}
case "$BUILD_DIR" in /*) ;; *) BUILD_DIR=$PWD/$BUILD_DIR ;; esac

VORBEL_PACKAGES=(cmake ninja-build g++-mingw-w64-x86-64-posix wine64 googletest
  flatbuffers-compiler libflatbuffers-dev osslsigncode openssl nlohmann-json3-dev)

# install_missing [extra packages...]: apt-get installs what is not there yet.
install_missing() {
  local missing=() p
  for p in "${VORBEL_PACKAGES[@]}" "$@"; do
    dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed' || missing+=("$p")
  done
  [ ${#missing[@]} -eq 0 ] && return 0
  echo "== installing: ${missing[*]}"
  local sudo=""
  [ "$(id -u)" -ne 0 ] && sudo="sudo"
  export DEBIAN_FRONTEND=noninteractive
  if ! $sudo apt-get install -y -q --no-install-recommends "${missing[@]}" >/dev/null; then
    $sudo apt-get update -q >/dev/null
    $sudo apt-get install -y -q --no-install-recommends "${missing[@]}" >/dev/null
  fi
}

configure_and_build() {
  echo "== configure and build in $BUILD_DIR"
  cmake -S "$ROOT" -B "$BUILD_DIR" -G Ninja \
    -DCMAKE_TOOLCHAIN_FILE="$ROOT/cmake/mingw-w64.cmake" "$@" >/dev/null
  cmake --build "$BUILD_DIR"
}

# find_wine: sets WINE (the loader) and WINESERVER where Debian's wine64
# package puts them; the `wine` package's PATH entries are used only when
# that package is what is installed. Checked once per shell; stops with one
# line naming the package when either is absent.
find_wine() {
  [ -n "${WINE:-}" ] && [ -n "${WINESERVER:-}" ] && return 0
  local c
  WINE=""
  WINESERVER=""
  for c in /usr/lib/wine/wine64 "$(command -v wine64 2>/dev/null)" "$(command -v wine 2>/dev/null)"; do
    [ -n "$c" ] && [ -x "$c" ] && { WINE=$c; break; }
  done
  for c in /usr/lib/wine/wineserver64 /usr/lib/wine/wineserver "$(command -v wineserver 2>/dev/null)"; do
    [ -n "$c" ] && [ -x "$c" ] && { WINESERVER=$c; break; }
  done
  if [ -z "$WINE" ] || [ -z "$WINESERVER" ]; then
    echo "error: Wine's $([ -z "$WINE" ] && echo loader || echo server) is missing (looked for /usr/lib/wine/wine64 and /usr/lib/wine/wineserver64): install the Debian package wine64" >&2
    exit 1
  fi
  export WINE WINESERVER
}

# wineserver_ctl ARGS...: the server of this build tree's prefix only; a
# bare `wineserver -k` would stop the user's default prefix instead.
wineserver_ctl() {
  WINEPREFIX="${WINEPREFIX:?WINEPREFIX must name the prefix}" "$WINESERVER" "$@"
}

# start_wine: a prefix inside the build tree and one persistent wineserver
# for the run (process start drops from ~0.5 s to ~0.05 s); stopped on exit.
start_wine() {
  find_wine
  export WINEPREFIX="$BUILD_DIR/wineprefix"
  export WINEDEBUG=-all
  export WINEDLLOVERRIDES="mscoree,mshtml="
  wineserver_ctl -k 2>/dev/null || true
  if [ ! -f "$WINEPREFIX/system.reg" ]; then
    echo "== creating the Wine prefix"
    "$WINE" wineboot -i </dev/null >/dev/null 2>&1 || true
    wineserver_ctl -w
  fi
  wineserver_ctl -p
  trap stop_wine EXIT
  # Start Wine's own services now, detached from our output: started by the
  # first test instead, they would inherit CTest's pipe and hold it open.
  "$WINE" cmd /c exit </dev/null >/dev/null 2>&1 || true
}

stop_wine() {
  wineserver_ctl -k 2>/dev/null || true
  wineserver_ctl -w 2>/dev/null || true
}
