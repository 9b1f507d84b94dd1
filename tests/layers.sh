#!/bin/sh
# Fails when a source includes a folder above its own: each folder may use
# only those before it in $order; the client library only core and wire;
# drkit every layer but daemon.
set -eu
cd "$1"
order="core wire pdoc platform registry plugin store daemon"
status=0
for file in $(git ls-files '*.cc' '*.h' 2>/dev/null || find . -name '*.cc' -o -name '*.h'); do
  file=${file#./}
  case "$file" in
    client/drkit/*) allowed="client core wire pdoc platform registry plugin store" ;;
    client/*) allowed="client core wire" ;;
    *)
      top=${file%%/*}
      case " $order " in *" $top "*) ;; *) continue ;; esac
      allowed=${order%%"$top"*}$top
      ;;
  esac
  for used in $(sed -n 's/^#include "\([a-z_]*\)\/.*/\1/p' "$file" | sort -u); do
    case " $allowed " in
      *" $used "*) ;;
      *) echo "$file uses $used/, which lies above it"; status=1 ;;
    esac
  done
done
exit $status
