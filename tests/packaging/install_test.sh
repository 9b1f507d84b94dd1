#!/bin/sh
# drd as people install it from a build folder that has been built:
#
#   install_test.sh install BUILD   cmake --install into a temporary prefix
#                                   (as `--prefix ~/.local` would), then check
#                                   the files, the units, the headers and the
#                                   installed drd
#
# The Debian packages are checked by debian_test.sh (./dev package).
# Exit 0 on success, 1 on a failure (with a message).
set -eu
mode=$1
build=$2
work=$(mktemp -d "${TMPDIR:-/tmp}/drd-install-test.XXXXXX")
trap 'rm -rf "$work"' EXIT

fail() {
  echo "FAIL: $*" >&2
  exit 1
}
# The value of `Key=` in a unit file: its last occurrence.
unit_value() {
  sed -n "s/^$2=//p" "$1" | tail -n 1
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
  # Outside /usr and /usr/local the units go where `systemd --user` looks
  # under a prefix: share/systemd/user (~/.local/share/systemd/user).
  for f in bin/drd bin/drkit share/systemd/user/drd.socket share/systemd/user/drd.service \
    share/man/man1/drkit.1 share/man/man8/drd.8 share/bash-completion/completions/drkit \
    share/doc/drd/README.md share/doc/drd/examples/README.md \
    share/doc/drd/examples/SDKs/org.example.gallery.filter.pdoc \
    share/doc/drd/examples/Gallery.app/Contents/Info.pdoc; do
    [ -f "$prefix/$f" ] || fail "$f is not installed"
  done
  for f in bin/drd share/doc/drd/examples/Gallery.app/Contents/Exec/gallery; do
    [ -x "$prefix/$f" ] || fail "$f is not executable"
  done
  check_units "$prefix/share/systemd/user" "$prefix/bin/drd"
  [ ! -e "$prefix/lib/systemd" ] || fail "units are also installed under lib/systemd"

  # The headers a host includes compile on their own with what
  # drd-client.pc says, and the .pc file names this prefix.
  pc=$(find "$prefix" -name drd-client.pc)
  [ -n "$pc" ] || fail "drd-client.pc is not installed"
  grep -qx "prefix=$prefix" "$pc" || fail "drd-client.pc names another prefix: $(grep ^prefix= "$pc")"
  cflags=$(PKG_CONFIG_PATH=$(dirname "$pc") pkg-config --cflags drd-client) || fail "pkg-config"
  for header in $(cd "$prefix/include" && find drd -name '*.h' | sort); do
    # shellcheck disable=SC2086
    printf '#include <%s>\n' "$header" | c++ -std=c++20 -fsyntax-only $cflags -x c++ - ||
      fail "installed header $header does not compile on its own"
  done

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
      "$prefix/share/systemd/user/drd.socket" "$prefix/share/systemd/user/drd.service" \
      >"$work/verify" 2>&1 || {
      cat "$work/verify"
      fail "systemd-analyze verify --user"
    }
    if grep -Ei 'drd\.(service|socket).*(unknown|invalid|ignoring|failed)' "$work/verify"; then
      fail "systemd-analyze complains about the units"
    fi
    # The sandbox stays as tight as drd allows (1.2 when it was made).
    exposure=$(systemd-analyze security --offline=true --user \
      "$prefix/share/systemd/user/drd.service" 2>&1 |
      sed -n 's/.*exposure level for drd.service: \([0-9.]*\).*/\1/p')
    [ -n "$exposure" ] && awk "BEGIN { exit !($exposure <= 2.0) }" ||
      fail "systemd-analyze security rates drd.service '$exposure', above 2.0"
  else
    echo "systemd-analyze is not installed: the units' settings were not verified"
  fi
  ;;
*)
  fail "unknown mode $mode"
  ;;
esac
echo "ok: $mode"
