#!/usr/bin/env bash
# Keeps the generated parts of docs/ in step with their sources:
#   - renders architecture.dot to architecture.png with graphviz's dot
#     (installed with apt-get when missing);
#   - copies the files of examples/minimal_host into host-guide.md, between
#     its "<!-- begin FILE -->" and "<!-- end FILE -->" markers.
# With --check it changes nothing and exits 1 when host-guide.md's copies
# differ from the files (the picture is not compared: dot's output varies
# between graphviz versions).
set -euo pipefail
here=$(cd "$(dirname "$0")" && pwd)
root=$(cd "$here/.." && pwd)
guide="$here/host-guide.md"
check=0
[ "${1:-}" = "--check" ] && check=1

# embed FILE FENCE: host-guide.md with FILE's text between its markers.
embed() {
  local file=$1 fence=$2
  awk -v file="$file" -v src="$root/$file" -v fence="$fence" '
    $0 == "<!-- begin " file " -->" {
      print; print ""; print "```" fence
      while ((getline line < src) > 0) print line
      close(src)
      print "```"; print ""
      skipping = 1; next
    }
    $0 == "<!-- end " file " -->" { skipping = 0 }
    !skipping { print }
  '
}

updated=$(embed examples/minimal_host/main.cpp cpp <"$guide" |
  embed examples/minimal_host/CMakeLists.txt cmake)
if [ "$check" = 1 ]; then
  if [ "$updated" != "$(cat "$guide")" ]; then
    echo "docs/host-guide.md: its copy of examples/minimal_host is stale; run docs/update.sh" >&2
    exit 1
  fi
  echo "docs/host-guide.md: examples/minimal_host copies are current"
  exit 0
fi
printf '%s\n' "$updated" >"$guide"
echo "updated $guide"

if ! command -v dot >/dev/null; then
  sudo=""
  [ "$(id -u)" -ne 0 ] && sudo="sudo"
  DEBIAN_FRONTEND=noninteractive $sudo apt-get install -y -q --no-install-recommends graphviz >/dev/null
fi
dot -Tpng -Gdpi=100 "$here/architecture.dot" -o "$here/architecture.png"
echo "wrote $here/architecture.png"
