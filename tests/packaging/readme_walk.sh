#!/bin/sh
# A newcomer's walk through README.md and examples/README.md, from the top of
# the repository after a release build (./dev walk): `./dev`, `./dev examples`
# in the background, then in "another shell" (`. build/examples/env`) each
# drkit command the two READMEs show, with what it must print; last, the
# README's `cmake --install --prefix ~/.local` with a scratch HOME.
#
# Exit 0 on success, 1 on a failure (with a message).
set -eu
cd "$(dirname "$0")/../.."
work=$(mktemp -d "${TMPDIR:-/tmp}/drd-walk.XXXXXX")
dev_pid=
cleanup() {
  [ -z "$dev_pid" ] || kill "$dev_pid" 2>/dev/null || true
  rm -rf "$work"
}
trap cleanup EXIT
fail() {
  echo "FAIL: $*" >&2
  [ ! -f "$work/dev.log" ] || sed 's/^/  dev examples: /' "$work/dev.log" >&2
  exit 1
}
# expect DESCRIPTION EXPECTED COMMAND...: COMMAND's standard output must be
# EXPECTED, and its status 0.
expect() {
  what=$1 want=$2
  shift 2
  got=$("$@" 2>"$work/err") || fail "$what: status $? ($(cat "$work/err"))"
  [ "$got" = "$want" ] || fail "$what: printed
$got
instead of
$want"
}

# ---- README: ./dev lists its commands -----------------------------------------
./dev >"$work/help" || fail "./dev exited $?"
for command in deps build run test package examples walk fuzz bench; do
  grep -q "^  ./dev $command" "$work/help" || fail "./dev does not list '$command'"
done

# ---- examples/README.md: ./dev examples, then another shell ---------------------
rm -rf build/examples
./dev examples >"$work/dev.log" 2>&1 &
dev_pid=$!
i=0
until grep -q 'Ctrl-C here stops drd' "$work/dev.log" 2>/dev/null; do
  i=$((i + 1))
  [ $i -lt 600 ] && kill -0 "$dev_pid" 2>/dev/null || fail "./dev examples did not get ready"
  sleep 0.1
done
grep -q '^  \. build/examples/env' "$work/dev.log" || fail "./dev examples does not say what to source"
# shellcheck source=/dev/null
. build/examples/env
[ "$(command -v drkit)" = "$PWD/build/release/client/drkit" ] || fail "the env does not put drkit on PATH"

filter=org.example.gallery.filter
expect "drkit match -p $filter" "  $filter.brightness (2.0)
  $filter.contrast (2.0)
  $filter.sepia (1.2)
  $filter.vignette (0.9)" drkit match -p "$filter"
# Gallery was installed by copying it into the install folder; registering
# its bundles again by hand changes nothing.
gallery=$DR_PLUGIN_PATH/Gallery.app/Contents/PlugIns
[ -d "$gallery" ] || fail "./dev examples did not install Gallery into $DR_PLUGIN_PATH"
expect "drkit add (again)" "" drkit add "$gallery"/*.appex
# The table of "What a host asks", as typed rules.
identifiers() { drkit match "$@" | sed 's/^. \([^ ]*\) .*/\1/' | tr '\n' ' '; }
expect "presets" "org.example.gallery.presets " \
  identifiers --rule UXExtensionPointName=org.example.gallery.presets
expect "one PNG" "$filter.brightness $filter.contrast $filter.sepia " \
  identifiers --rule 'AcceptedTypes:={"image/png": 1}'
expect "two JPEGs" "$filter.sepia " identifiers --rule 'AcceptedTypes:={"image/jpeg": 2}'

# ---- README: the drkit verbs, in the same world -----------------------------------
sepia=$filter.sepia
uuid=$(drkit match -i "$sepia" --json | sed 's/.*"uuid":"\([^"]*\)".*/\1/')
expect "status" "service: com.corvel.dromon.drd
socket: $DR_SOCKET_DIR/com.corvel.dromon.drd
state: answering" drkit status
drkit explain "$sepia" >"$work/explain" || fail "drkit explain: $(cat "$work/explain")"
grep -q '^    discovery: returned$' "$work/explain" || fail "drkit explain: $(cat "$work/explain")"
expect "elect" "" drkit elect -i "$sepia" use
expect "annotate" "" drkit annotate -i "$sepia" strength=3
expect "annotate (show)" '{"strength":"3"}' drkit annotate -i "$sepia"
expect "match -i after elect" "+ $sepia (1.2)" drkit match -i "$sepia"
expect "ready" "" drkit ready "$uuid"
token=$(drkit access "$uuid") || fail "drkit access"
expect "extension consume" "$gallery/Sepia.appex" drkit extension consume "$token"
expect "extension open" "Contents" drkit extension open "$token"
expect "exclude add" "" drkit exclude add -i "$sepia"
expect "exclude list" "1: {\"UXExtensionIdentifier\":\"$sepia\"}" drkit exclude list
expect "match when excluded" "" drkit match -i "$sepia"
expect "exclude remove" "" drkit exclude remove 1
[ ! -e "$HOME/.config/dromon/ByHost" ] || [ "$XDG_CONFIG_HOME" != "$HOME/.config" ] ||
  fail "drkit exclude wrote the user's own preferences"
hold=$(drkit hold --plug-in "$gallery/Sepia.appex" </dev/null) ||
  fail "drkit hold"
expect "release" "" drkit release "$hold"
expect "raw" '{"matches":[]}' drkit raw '{"request": "match", "version": 2, "rules": {"UXExtensionIdentifier": "none"}}'
drkit watch --count 1 >"$work/watch" 2>/dev/null &
watch_pid=$!
sleep 0.5
drkit elect -i "$sepia" default
wait "$watch_pid" || fail "drkit watch"
grep -q '^com.corvel.dromon.annotation-change [0-9]*$' "$work/watch" || fail "watch: $(cat "$work/watch")"
expect "remove" "" drkit remove "$gallery/Presets.appex"

# Leaving ./dev examples stops drd and takes its socket away, quietly.
kill "$dev_pid"
wait "$dev_pid" || true
dev_pid=
i=0
until grep -q '^drd stopped$' "$work/dev.log"; do
  i=$((i + 1))
  [ $i -lt 50 ] || fail "drd did not stop (or say so) after ./dev examples ended"
  sleep 0.1
done
[ ! -e "$DR_SOCKET_DIR/com.corvel.dromon.drd" ] || fail "drd's socket stays after it stopped"
if grep -q 'unbound variable' "$work/dev.log"; then fail "./dev examples broke on leaving"; fi
drkit status >/dev/null 2>"$work/err" && fail "drkit status answers after drd stopped"
grep -q "drd is not running; start it" "$work/err" || fail "no hint to start drd: $(cat "$work/err")"

# ---- README: cmake --install --prefix ~/.local ------------------------------------
HOME=$work/home
cmake --install build/release --prefix "$HOME/.local" >"$work/install.log" 2>&1 ||
  fail "cmake --install: $(cat "$work/install.log")"
grep -qx "ExecStart=$HOME/.local/bin/drd" "$HOME/.local/share/systemd/user/drd.service" ||
  fail "the user units are not in ~/.local/share/systemd/user"
echo "ok: walk"
