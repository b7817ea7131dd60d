#!/bin/sh
# Checks the generated units with systemd-analyze verify: every warning is a
# failure. Usage: verify-units.sh <directory with system/ and user/>
set -u
units=$1
if ! command -v systemd-analyze >/dev/null 2>&1; then
  echo "systemd-analyze is not installed (scripts/setup installs systemd); skipped"
  exit 77
fi
status=0
check() {  # scope directory [--user]
  scope=$1; shift
  cd "$units/$scope" || exit 1
  output=$(systemd-analyze "$@" verify --man=no ./tenond.socket ./tenond-warden.socket ./tenond-vigil.socket \
           ./tenond.service 2>&1)
  code=$?
  if [ $code -ne 0 ] || [ -n "$output" ]; then
    echo "$scope units: systemd-analyze verify exited $code:"
    echo "$output"
    status=1
  else
    echo "$scope units verified"
  fi
}
check system
runtime=$(mktemp -d)
XDG_RUNTIME_DIR=$runtime check user --user
rm -rf "$runtime"
exit $status
