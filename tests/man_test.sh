#!/usr/bin/env bash
# The manual pages of a build, BUILD/man/tarnmon.1 and BUILD/man/telvzopt.trm.5.
#   man_test.sh render BUILD    both pages format with groff and with man -l, with every warning
#                               on, and neither writes anything on standard error
#   man_test.sh commands BUILD  every command, option and exit status that tarnmon's own help
#                               shows is in tarnmon(1)
set -euo pipefail

mode=$1
build=$2
pages=("$build/man/tarnmon.1" "$build/man/telvzopt.trm.5")
export LC_ALL=C.UTF-8 MANPAGER=cat PAGER=cat MANWIDTH=80
fail=0

need() {
  command -v "$1" >/dev/null || { echo "$1 is not installed (tools/install-deps.sh installs it)"; exit 1; }
}

# The page as plain text: no bold, underline or overstrike, ASCII hyphens.
plain() {
  groff -man -Tascii -P-c -P-b -P-u "$1" 2>/dev/null
}

# The lines of a rendered page's section, from its heading to the next one.
section() {
  awk -v name="$1" '/^[A-Z]/ { inside = ($0 == name); next } inside'
}

render() {
  need groff
  need man
  for page in "${pages[@]}"; do
    [ -s "$page" ] || { echo "FAIL: $page is missing or empty"; fail=1; continue; }
    if grep -nE '@[A-Za-z_]+@' "$page"; then
      echo "FAIL: $page keeps a placeholder of its template"; fail=1
    fi
    err=$(groff -man -Tutf8 -ww -z "$page" 2>&1 >/dev/null) || { echo "FAIL: groff failed on $page"; fail=1; }
    if [ -n "$err" ]; then echo "FAIL: groff warns on $page:"; echo "$err"; fail=1; fi
    err=$(man --warnings=w -l "$page" 2>&1 >/dev/null) || { echo "FAIL: man -l failed on $page"; fail=1; }
    if [ -n "$err" ]; then echo "FAIL: man -l warns on $page:"; echo "$err"; fail=1; fi
    out=$(man -l "$page" 2>/dev/null | wc -l)
    [ "$out" -gt 20 ] || { echo "FAIL: man -l $page shows $out lines"; fail=1; }
  done
}

commands() {
  need groff
  tarnmon="$build/tarnmon"
  page="$build/man/tarnmon.1"
  [ -x "$tarnmon" ] || { echo "FAIL: no $tarnmon"; exit 1; }
  text=$(plain "$page")
  listed=$(section COMMANDS <<<"$text")
  options=$(section OPTIONS <<<"$text")
  statuses=$(section "EXIT STATUS" <<<"$text")
  help=$("$tarnmon" help)
  # The command lines of the list: two blanks, then the command's name.
  names=$(sed -n '/^commands:/,/^$/p' <<<"$help" | grep -E '^  [a-z]' | awk '{ print $1 }')
  [ -n "$names" ] || { echo "FAIL: no commands in tarnmon help"; exit 1; }
  exits=$(grep -E '^exit status:' <<<"$help" | grep -oE '(^|[ :])[0-9]{1,3} [a-z]' | grep -oE '[0-9]+')
  for name in $names; do
    grep -qE "^ {7}$name( |$)" <<<"$listed" || { echo "FAIL: command $name is not in tarnmon(1)"; fail=1; }
    usage=$("$tarnmon" "$name" --help)
    for option in $(head -1 <<<"$usage" | grep -oE -- '--[a-z][a-z-]*'); do
      grep -qE -- "(^|[ ,])$option( |,|$)" <<<"$options" ||
        { echo "FAIL: option $option of $name is not in tarnmon(1)"; fail=1; }
      grep -qE -- "(^|[ [])$option( |]|$)" <<<"$listed" ||
        { echo "FAIL: option $option is not in the synopsis of $name"; fail=1; }
    done
    exits+=$'\n'$(sed -n '/^exit status:/,$p' <<<"$usage" | grep -oE '(^|[ :])[0-9]{1,3} [a-zA-Z]' | grep -oE '[0-9]+')
  done
  for status in $(sort -un <<<"$exits"); do
    grep -qE "^ {7}$status( |$)" <<<"$statuses" ||
      { echo "FAIL: exit status $status is not in tarnmon(1)"; fail=1; }
  done
  echo "commands: $(wc -w <<<"$names"), exit statuses: $(sort -un <<<"$exits" | tr '\n' ' ')"
}

case $mode in
  render) render ;;
  commands) commands ;;
  *) echo "usage: man_test.sh render|commands BUILD"; exit 2 ;;
esac
[ $fail -eq 0 ] && echo "PASS"
exit $fail
