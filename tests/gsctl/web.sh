#!/bin/bash
# web.sh BIN SCRIPT: the example's web server answers again, and from a newer leader, after each thing that can happen.
script=$(realpath "$2")
. "$(dirname "$0")/daemon.sh"
python3 -c 'import http.server' || { echo "skipped: no python3"; exit 77; }
PATH=$bin:$PATH

mkdir pages
echo hello >pages/index.html
port=$(python3 -c 'import socket; s = socket.socket(); s.bind(("127.0.0.1", 0)); print(s.getsockname()[1])')
group=web-$port

answers() { # from a leader that began after so many
  [ "$(wc -l <pages/.leader)" -gt "$1" ] || return 1
  exec 8<>"/dev/tcp/127.0.0.1/$port" || return 1
  printf 'GET / HTTP/1.0\r\n\r\n' >&8
  grep -q hello <&8
}
again() { # DISTURBANCE...
  local before
  before=$(wc -l <pages/.leader)
  "$@"
  await answers "$before"
}
declare -A candidate=() # process by id of the member
stand() {
  local count=$((${#candidate[@]} + 1))
  "$script" pages "$port" >web$count.log 2>&1 &
  local process=$!
  await "$gsctl" wait "$group" --members $count --timeout 1
  candidate[$("$gsctl" wait "$group" --members $count --json | grep -o '{"instance":[0-9]*' | tail -n 1 | grep -o '[0-9]*')]=$process
}
leader() { echo "${candidate[$("$gsctl" wait "$group" --leader | cut -d/ -f1)]}"; }

: >pages/.leader
start_gsd
again stand
stand
stand

again kill -KILL "$(tail -n 1 pages/.leader | cut -d' ' -f3)"
again kill -KILL "$(leader)"
stopped=$(leader)
again kill -STOP "$stopped"
kill -CONT "$stopped"
restart() {
  kill -KILL $gsd
  start_gsd
}
again restart
sort -c -s -n -k1,1 pages/.leader || die "a server was begun with an older fence: $(cat pages/.leader)"
awk '$1 == fence && $2 != leader { exit 1 } { fence = $1; leader = $2 }' pages/.leader ||
  die "two leaders have one fence: $(cat pages/.leader)"
