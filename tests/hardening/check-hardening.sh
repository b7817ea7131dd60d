#!/bin/sh
# Checks that each binary given was built hardened (cmake/TenonHardening.cmake):
# a position-independent executable, full RELRO with immediate binding, the
# stack protector and fortified libc calls. Prints one line per failure and
# exits 1 when any check fails.
set -u
status=0
fail() { echo "$1: $2"; status=1; }

for binary in "$@"; do
  header=$(readelf -h "$binary") || { fail "$binary" "not readable as ELF"; continue; }
  dynamic=$(readelf -d "$binary")
  segments=$(readelf -lW "$binary")
  symbols=$(readelf --dyn-syms -W "$binary")
  echo "$header" | grep -q 'Type:[[:space:]]*DYN' || fail "$binary" "not position-independent (ELF type is not DYN)"
  echo "$dynamic" | grep -q 'FLAGS_1.*PIE' || fail "$binary" "no PIE flag in the dynamic section"
  echo "$segments" | grep -q 'GNU_RELRO' || fail "$binary" "no GNU_RELRO segment"
  echo "$dynamic" | grep -Eq 'BIND_NOW|FLAGS.*[[:space:]]NOW' || fail "$binary" "not bound immediately (no BIND_NOW)"
  echo "$symbols" | grep -q '__stack_chk_fail' || fail "$binary" "no stack protector (__stack_chk_fail)"
  echo "$symbols" | grep -Eq '__[a-z0-9_]+_chk(@|$| )' || fail "$binary" "no fortified libc call (__*_chk)"
done
[ "$status" -eq 0 ] && echo "hardened: $*"
exit "$status"
