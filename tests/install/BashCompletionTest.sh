#!/usr/bin/env bash
# BashCompletionTest.sh COMPLETION TNCTL: the bash completion for tnctl offers
# tnctl's subcommands, a subcommand's own subcommands and options, and file
# names where a subcommand takes paths.
# No -e: completion functions return the status of their last test.
completion=$1
tnctl=$2
# shellcheck source=/dev/null
source "$completion"

failures=0
# expect_completion EXPECTED WORDS...: completing the last word gives EXPECTED.
expect_completion() {
  local expected=$1
  shift
  COMP_WORDS=("$@")
  COMP_CWORD=$((${#COMP_WORDS[@]} - 1))
  COMPREPLY=()
  _tnctl
  local got="${COMPREPLY[*]}"
  if [[ $got != "$expected" ]]; then
    echo "completing '${*:2}': expected '$expected', got '$got'" >&2
    failures=$((failures + 1))
  fi
}

expect_completion "registry remove ready release request" "$tnctl" re
expect_completion "show scan" "$tnctl" registry s
expect_completion "list busy" "$tnctl" warden ""
expect_completion "show scan" "$tnctl" --json --service some.service registry s
expect_completion "--rules" "$tnctl" match --ru
expect_completion "" "$tnctl" --service ""

files=$(mktemp -d)
trap 'rm -rf "$files"' EXIT
mkdir "$files/Viewer.bundle"
expect_completion "$files/Viewer.bundle" "$tnctl" lint "$files/Vi"

if ((failures > 0)); then
  exit 1
fi
echo "bash completion: all cases pass"
