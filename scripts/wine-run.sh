#!/usr/bin/env bash
# Runs a Windows program under Wine with the build tree's own prefix.
# WINEPREFIX defaults to the prefix inside the build tree that holds the
# program (the nearest parent folder with a CMakeCache.txt).
set -e
if [ -z "${WINEPREFIX:-}" ]; then
  d=$(cd "$(dirname "$1")" && pwd)
  while [ "$d" != "/" ] && [ ! -f "$d/CMakeCache.txt" ]; do d=$(dirname "$d"); done
  [ "$d" = "/" ] && d=$(pwd)
  export WINEPREFIX="$d/wineprefix"
fi
export WINEDEBUG="${WINEDEBUG:--all}"
export WINEDLLOVERRIDES="${WINEDLLOVERRIDES:-mscoree,mshtml=}"
exec /usr/lib/wine/wine64 "$@"
