#!/bin/sh
# drd's Debian packages as people meet them, from a folder that holds the
# built .deb files (./dev package runs this on build/package):
#
#   - lintian finds no error and no warning that is not overridden with a
#     reason (debian/*.lintian-overrides);
#   - the library package carries its soname's shlibs and the ldconfig
#     trigger, and units are enabled by debhelper's generated scripts;
#   - installed into a scratch root, the example host builds with
#     `pkg-config drd-client` alone (each header compiling alone is checked
#     by install_test.sh), then discovers and readies the examples' plug-ins
#     through the installed drd and drkit;
#   - `man drkit` and `man drd` show the pages, and bash completes drkit's
#     verbs and options from the installed completion.
#
# Exit 0 on success, 1 on a failure (with a message).
set -eu
dir=$1
source_dir=$(cd "$(dirname "$0")/../.." && pwd)
work=$(mktemp -d "${TMPDIR:-/tmp}/drd-debian-test.XXXXXX")
drd_pid=
cleanup() {
  [ -z "$drd_pid" ] || kill "$drd_pid" 2>/dev/null || true
  rm -rf "$work"
}
trap cleanup EXIT

fail() {
  echo "FAIL: $*" >&2
  exit 1
}
one_deb() {  # the one .deb of package $1
  set -- "$dir/$1"_*.deb
  [ $# = 1 ] && [ -f "$1" ] || fail "no single package file $*"
  echo "$1"
}

drd_deb=$(one_deb drd)
lib_deb=$(one_deb libdrd-client0)
dev_deb=$(one_deb libdrd-client-dev)

# ---- lintian -------------------------------------------------------------------
lintian --fail-on error,warning --display-level ">=warning" --show-overrides \
  "$drd_deb" "$lib_deb" "$dev_deb" >"$work/lintian" 2>&1 || {
  cat "$work/lintian"
  fail "lintian"
}
if grep -E '^[EW]: ' "$work/lintian"; then fail "lintian reports the lines above"; fi

# ---- control data --------------------------------------------------------------
dpkg-deb -e "$lib_deb" "$work/lib-control"
grep -Eq '^libdrd-client 0 libdrd-client0( |$)' "$work/lib-control/shlibs" ||
  fail "libdrd-client0 has no shlibs line for libdrd-client.so.0"
grep -Eq '^activate-noawait ldconfig$' "$work/lib-control/triggers" ||
  fail "libdrd-client0 has no ldconfig trigger"
dpkg-deb -f "$dev_deb" Depends | grep -q 'libdrd-client0 (= ' ||
  fail "libdrd-client-dev does not depend on its exact library"
dpkg-deb -e "$drd_deb" "$work/drd-control"
grep -q 'deb-systemd-helper --user' "$work/drd-control/postinst" ||
  fail "drd's postinst does not enable the user units through deb-systemd-helper"
if grep -q 'systemctl --global' "$work/drd-control/postinst"; then
  fail "drd's postinst calls systemctl by hand"
fi

for deb in "$lib_deb" "$dev_deb"; do
  [ "$(dpkg-deb -f "$deb" Version)" = "$(dpkg-deb -f "$drd_deb" Version)" ] ||
    fail "$deb and $drd_deb differ in version"
done

# ---- installed into a scratch root ---------------------------------------------
root=$work/root
for deb in "$drd_deb" "$lib_deb" "$dev_deb"; do dpkg-deb -x "$deb" "$root"; done
multiarch=$(dpkg-architecture -qDEB_HOST_MULTIARCH)
libdir=$root/usr/lib/$multiarch
[ -f "$root/usr/lib/systemd/user/drd.socket" ] || fail "drd.socket is not installed"
grep -qx 'ExecStart=/usr/bin/drd' "$root/usr/lib/systemd/user/drd.service" ||
  fail "drd.service does not start /usr/bin/drd"
for doc in drd libdrd-client0 libdrd-client-dev; do
  [ -f "$root/usr/share/doc/$doc/copyright" ] || fail "$doc has no copyright file"
done

# pkg-config alone, as a host author would use it (the sysroot puts the
# scratch root in front of every path the .pc file gives).
export PKG_CONFIG_SYSROOT_DIR="$root" PKG_CONFIG_LIBDIR="$libdir/pkgconfig"
cflags=$(pkg-config --cflags drd-client) || fail "pkg-config --cflags drd-client"
libs=$(pkg-config --libs drd-client) || fail "pkg-config --libs drd-client"
# shellcheck disable=SC2086
c++ -std=c++20 -o "$work/host_example" "$source_dir/client/examples/host_example.cc" \
  $cflags $libs || fail "the example host does not build against the installed packages"

# The installed drd and drkit, in a world of their own, with the examples.
world=$work/world
export LD_LIBRARY_PATH="$libdir" DR_SOCKET_DIR="$world/run" DR_REGISTRY="$world/registry.sqlite3"
export XDG_STATE_HOME="$world/state" XDG_CONFIG_HOME="$world/config" XDG_DATA_HOME="$world/data"
export DR_PLUGIN_PATH="" DR_SDK_PATH="$source_dir/examples/SDKs"
"$root/usr/bin/drd" 2>"$work/drd.log" &
drd_pid=$!
i=0
until "$root/usr/bin/drkit" status >/dev/null 2>&1; do
  i=$((i + 1))
  [ $i -lt 100 ] || fail "the installed drd does not answer: $(cat "$work/drd.log")"
  sleep 0.1
done
"$root/usr/bin/drkit" add "$source_dir"/examples/Gallery.app/Contents/PlugIns/*.appex ||
  fail "drkit add"
"$work/host_example" org.example.gallery.filter org.example.gallery.filter.sepia \
  >"$work/host.out" 2>&1 || fail "the example host failed: $(cat "$work/host.out")"
grep -qx 'readied org.example.gallery.filter.sepia' "$work/host.out" ||
  fail "the example host did not ready sepia: $(cat "$work/host.out")"
[ "$("$root/usr/bin/drd" --version)" = "drd $(dpkg-deb -f "$drd_deb" Version)" ] ||
  fail "drd --version and the package's version differ: $("$root/usr/bin/drd" --version)"
kill "$drd_pid"
wait "$drd_pid" || fail "drd did not stop cleanly: $(cat "$work/drd.log")"
drd_pid=
[ ! -e "$DR_SOCKET_DIR/com.corvel.dromon.drd" ] || fail "drd left its socket behind"

# ---- manual pages and completion -----------------------------------------------
for page in drkit drd; do
  MANPATH="$root/usr/share/man" MANWIDTH=80 man -P cat "$page" >"$work/$page.man" 2>&1 ||
    fail "man $page: $(cat "$work/$page.man")"
  grep -q "^NAME" "$work/$page.man" || fail "man $page shows no page"
done
grep -q 'drkit match \[OPTIONS\]' "$work/drkit.man" || fail "drkit(1) lacks the verbs"
completion=$root/usr/share/bash-completion/completions/drkit
# COMPREPLY of _drkit for the words given, on one line.
complete_words() {
  bash -c '. "$0"; complete -p drkit >/dev/null || exit 1
    COMP_WORDS=("$@"); COMP_CWORD=$(($# - 1)); _drkit; echo "${COMPREPLY[*]}"' \
    "$completion" "$@"
}
[ "$(complete_words drkit ma)" = match ] || fail "completing 'drkit ma': $(complete_words drkit ma)"
[ "$(complete_words drkit -S x ex)" = "extension exclude explain" ] ||
  fail "completing 'drkit -S x ex': $(complete_words drkit -S x ex)"
[ "$(complete_words drkit match --all-)" = --all-versions ] ||
  fail "completing 'drkit match --all-': $(complete_words drkit match --all-)"
[ "$(complete_words drkit elect -i x i)" = ignore ] ||
  fail "completing 'drkit elect -i x i': $(complete_words drkit elect -i x i)"
echo "ok: debian"
