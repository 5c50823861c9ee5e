#!/bin/bash
# tour.sh BIN GUIDE: does what the guide's blocks of "console" show, one after the other in one shell, and compares what
# is said with what stands there. What is another one each time (numbers of events and processes, times, versions,
# users) is not compared.
guide=$(realpath "$2")
. "$(dirname "$0")/daemon.sh"
export PATH=$bin:$PATH
start_gsd

normal() {
  sed -E -e 's/"[a-z_]*ms":-?[0-9]+/"ms":N/g' -e 's/"(pid|uid)":[0-9]+/"\1":N/g' \
    -e 's/[0-9]{2}:[0-9]{2}:[0-9]{2}\.[0-9]{3}/TIME/g' -e 's/[0-9]{4}-[0-9]{2}-[0-9]{2}T[0-9:.]+Z/TIME/g' \
    -e 's/[0-9]+(\.[0-9]+)? (ms|s|min|h|µs)\b/SPAN/g' -e 's/gsd [0-9.]+/gsd VERSION/' -e 's/pid [0-9]+/pid N/g' \
    -e 's/gsctl +[0-9]+ +[^ ]+/gsctl N USER/g' -e 's/[0-9]{3,}/N/g' -e 's/ +/ /g' -e 's/ $//' -e '/^$/d'
}

# check COMMAND EXPECTED
check() {
  eval "$1" >said 2>&1 </dev/null
  diff <(normal <<<"$2") <(normal <said) >differences ||
    die "the guide shows another output of: $1"$'\n'"$(cat differences)"
}

checked=0 command="" expected=""
while IFS= read -r -u 9 line; do
  case $line in
    '$ '* | '```'*)
      [ -z "$command" ] || { check "$command" "$expected"; checked=$((checked + 1)); }
      command="" expected=""
      [[ $line != '$ '* ]] || command=${line#\$ }
      ;;
    *) expected+=$line$'\n' ;;
  esac
done 9< <(awk '/^```console/ { inside = 1 } inside { print } /^```$/ { inside = 0 }' "$guide")
[ $checked -gt 0 ] || die "$guide has nothing to do"
