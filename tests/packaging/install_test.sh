#!/bin/sh
# drd as people install it, from a build folder that has been built:
#
#   install_test.sh install BUILD   cmake --install into a temporary prefix,
#                                   then check the files, the units and the
#                                   installed drd
#   install_test.sh debian BUILD    cpack the Debian package into a temporary
#                                   folder, then check its fields and files
#
# Exit 0 on success, 1 on a failure (with a message), 77 when a tool the check
# needs is not installed.
set -eu
mode=$1
build=$2
work=$(mktemp -d "${TMPDIR:-/tmp}/drd-install-test.XXXXXX")
trap 'rm -rf "$work"' EXIT

fail() {
  echo "FAIL: $*" >&2
  exit 1
}
skip() {
  echo "SKIP: $*"
  exit 77
}
# The value of `Key=` in a unit file: its last occurrence.
unit_value() {
  sed -n "s/^$2=//p" "$1" | tail -n 1
}
# Fails unless `Depends`-style list $1 names package $2.
must_depend() {
  echo ", $1," | grep -Eq "[ ,]$2([ ,(:]|$)" || fail "Depends lacks $2: $1"
}

check_units() {  # UNIT_DIR EXPECTED_DRD
  service=$1/drd.service
  socket=$1/drd.socket
  [ -f "$service" ] && [ -f "$socket" ] || fail "the units are not in $1"
  if grep -nE '@[A-Za-z_]+@' "$service" "$socket"; then fail "a unit keeps a configure placeholder"; fi
  [ "$(unit_value "$service" ExecStart)" = "$2" ] ||
    fail "drd.service starts '$(unit_value "$service" ExecStart)', not $2"
  # drd tells systemd when it serves (sd_notify READY=1); any other type
  # would let clients in before that, or never count drd as started.
  [ "$(unit_value "$service" Type)" = notify ] || fail "drd.service is not Type=notify"
  # The socket must be where clients look by default and private to the user.
  [ "$(unit_value "$socket" ListenStream)" = "%t/dromon/com.corvel.dromon.drd" ] ||
    fail "drd.socket listens on $(unit_value "$socket" ListenStream)"
  [ "$(unit_value "$service" Environment)" = "DR_SOCKET_DIR=%t/dromon" ] ||
    fail "drd.service does not point DR_SOCKET_DIR at the socket's folder"
  [ "$(unit_value "$socket" SocketMode)" = 0600 ] || fail "drd.socket is not 0600"
  [ "$(unit_value "$socket" DirectoryMode)" = 0700 ] || fail "the socket folder is not 0700"
}

case $mode in
install)
  prefix=$work/prefix
  cmake --install "$build" --prefix "$prefix" >"$work/log" 2>&1 || {
    cat "$work/log"
    fail "cmake --install"
  }
  for f in bin/drd lib/systemd/user/drd.socket lib/systemd/user/drd.service \
    share/doc/drd/README.md share/doc/drd/examples/README.md \
    share/doc/drd/examples/SDKs/org.example.gallery.filter.pdoc \
    share/doc/drd/examples/Gallery.app/Contents/Info.pdoc; do
    [ -f "$prefix/$f" ] || fail "$f is not installed"
  done
  for f in bin/drd share/doc/drd/examples/Gallery.app/Contents/Exec/gallery; do
    [ -x "$prefix/$f" ] || fail "$f is not executable"
  done
  check_units "$prefix/lib/systemd/user" "$prefix/bin/drd"

  # The installed binary runs on its own (no path into the build folder).
  status=0
  "$prefix/bin/drd" -x 2>"$work/stderr" || status=$?
  [ "$status" = 2 ] || fail "installed drd -x exited $status, not 2"
  printf 'Usage: drd [-S servicename] [-v]\n' | cmp -s - "$work/stderr" ||
    fail "installed drd printed: $(cat "$work/stderr")"

  if command -v systemd-analyze >/dev/null 2>&1; then
    # Checks the syntax and every setting, and that ExecStart exists.
    export XDG_RUNTIME_DIR="${XDG_RUNTIME_DIR:-$work/run}"
    mkdir -p "$XDG_RUNTIME_DIR"
    systemd-analyze verify --user --man=no \
      "$prefix/lib/systemd/user/drd.socket" "$prefix/lib/systemd/user/drd.service" \
      >"$work/verify" 2>&1 || {
      cat "$work/verify"
      fail "systemd-analyze verify --user"
    }
    if grep -Ei 'drd\.(service|socket).*(unknown|invalid|ignoring|failed)' "$work/verify"; then
      fail "systemd-analyze complains about the units"
    fi
  else
    echo "systemd-analyze is not installed: the units' settings were not verified"
  fi
  ;;
debian)
  command -v cpack >/dev/null 2>&1 || skip "cpack is not installed"
  command -v dpkg-deb >/dev/null 2>&1 || skip "dpkg-deb is not installed"
  # gzip rather than xz: the same package, made in a fraction of the time.
  cpack --config "$build/CPackConfig.cmake" -B "$work/out" \
    -D CPACK_DEBIAN_COMPRESSION_TYPE=gzip >"$work/log" 2>&1 || {
    cat "$work/log"
    fail "cpack"
  }
  set -- "$work"/out/drd_*.deb
  [ $# = 1 ] && [ -f "$1" ] || fail "cpack made no single drd_*.deb: $*"
  deb=$1
  [ "$(dpkg-deb -f "$deb" Package)" = drd ] || fail "package name $(dpkg-deb -f "$deb" Package)"
  depends=$(dpkg-deb -f "$deb" Depends)
  for lib in libexpat1 libsqlite3-0 libsodium23 libicu72 libsystemd0; do
    must_depend "$depends" "$lib"
  done
  dpkg-deb -x "$deb" "$work/root"
  [ -x "$work/root/usr/bin/drd" ] || fail "the package has no /usr/bin/drd"
  check_units "$work/root/usr/lib/systemd/user" /usr/bin/drd
  dpkg-deb -e "$deb" "$work/control"
  for script in postinst prerm; do
    [ -x "$work/control/$script" ] || fail "the package has no executable $script"
    sh -n "$work/control/$script" || fail "$script is not valid sh"
  done
  ;;
*)
  fail "unknown mode $mode"
  ;;
esac
echo "ok: $mode"
