#!/bin/sh
# The drive T: of the test prefix for the protected-image-path tests: a
# folder tree owned by another user (uid 1), so that the user the tests run
# as may read it but neither change nor remove anything in it, as on a
# machine where programs are installed by an administrator:
#   T:\            root, read-only for us
#   T:\images\     read-only for us: an image here cannot be swapped
#   T:\open\       writable by everyone: an image here can
# Needs root for chown; without it nothing is made and the tests that need
# the drive skip.
#
#   protected_drive.sh setup DIR DOSDEVICES IMAGE   make DIR, link T: to it
#   protected_drive.sh cleanup DIR DOSDEVICES       remove both
set -eu
action=$1 dir=$2 devices=$3
case "$action" in
  setup)
    image=$4
    rm -rf "$dir" "$devices/t:"
    [ "$(id -u)" -eq 0 ] || { echo "protected_drive: not root, no drive T:"; exit 0; }
    mkdir -p "$dir/images" "$dir/open"
    cp "$image" "$dir/images/"
    cp "$image" "$dir/open/"
    chown -R 1:1 "$dir"
    chmod 755 "$dir" "$dir/images"
    chmod 777 "$dir/open"
    chmod 555 "$dir/images/"* "$dir/open/"*
    mkdir -p "$devices"
    ln -sfn "$dir" "$devices/t:"
    ;;
  cleanup)
    rm -f "$devices/t:"
    rm -rf "$dir"
    ;;
esac
