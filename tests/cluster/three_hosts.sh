#!/bin/bash
# three_hosts.sh CLUSTER BIN: a member on each of three hosts while hosts are cut off, hang and die. What each one was
# told must be one history. Run by itself it makes the hosts; 77: this machine does not allow it.
set -u
cluster=$1 bin=$2

if [ -z "${CLUSTER_IS_UP:-}" ]; then
  for program in corosync ip unshare; do
    command -v $program >/dev/null || { echo "skipped: there is no $program"; exit 77; }
  done
  export TOKEN=1000 WAIT=60
  "$cluster" run 3 true </dev/null || { echo "skipped: three hosts cannot be made here, see above"; exit 77; }
  here=$(mktemp -d)
  CLUSTER_IS_UP=$here "$cluster" run 3 "$0" "$cluster" "$bin" </dev/null
  status=$?
  [ $status -eq 0 ] || tail -n 100 "$here"/*.log
  rm -rf "$here"
  exit $status
fi

cd "$CLUSTER_IS_UP" || exit 2
export GSD_ENDPOINT=unix:/run/gsd.sock
declare -A daemon

die() { echo "$*" >&2; exit 1; }

# await TEXT FILE: until a line of the file has the text.
await() {
  local end=$((SECONDS + 60))
  until grep -qs -- "$1" "$2"; do
    [ $SECONDS -lt $end ] || die "no \"$1\" in $2"
    sleep 0.05
  done
}

start_daemon() { # HOST LOG: and waits until it serves
  "$cluster" on "$1" "$bin/gsd" --ordering corosync --member-timeout 2 --socket-path /run/gsd.sock >>"$2" 2>&1 &
  daemon[$1]=$!
  await "info serving" "$2"
}

# member HOST NUMBER: joins; what is written into in.NUMBER are its commands.
member() {
  mkfifo "in.$2"
  "$cluster" on "$1" "$bin/member" crew "$2" <"in.$2" >"member$2.log" 2>>"errors.log" &
  eval "exec 1$2>in.$2"
  await "$2 joins" "member$2.log"
}
tell() { echo "$2" >&"1$1"; } # NUMBER COMMAND

for h in 1 2 3; do start_daemon $h gsd$h.log; done
for h in 1 2 3; do member $h $h; done
tell 1 "state red"
for n in 1 2 3; do await 'the state is "red"' member$n.log; done

# Cut off: the others go on without it, it is told, and once healed it comes back with their state.
"$cluster" cut 3
await DIED_HORRIBLY member3.log
for n in 1 2; do await "3 has failed" member$n.log; done
! grep -q "has failed" member3.log || die "who was cut off was told that others have failed"
tell 1 "state blue"
await 'the state is "blue"' member2.log
"$cluster" heal
"$cluster" wait 1,2,3
member 3 4
await "members: 1 2 4" member4.log

# A daemon that hangs is left out as soon as something waits for it; awake again, it takes its clients' end and comes back.
kill -STOP "${daemon[3]}"
tell 1 "say on"
for n in 1 2; do await "4 has failed" member$n.log; done
kill -CONT "${daemon[3]}"
await DIED_HORRIBLY member4.log
member 3 5

# A daemon dies, and with it its members; its host's next daemon takes the state from the others.
kill -KILL "${daemon[1]}"
await DIED_HORRIBLY member1.log
for n in 2 5; do await "1 has failed" member$n.log; done
start_daemon 1 gsd1.again.log
member 1 6
tell 2 "say hello"
for n in 2 5 6; do await '2 says "hello"' member$n.log; done

# The same events with the same numbers, from when both were there. The first column is the time.
events() { grep -v announcement "member$1.log" | cut -d' ' -f2-; }
for n in 1 3 4 5 6; do
  first=$(events $n | grep -F -x -f <(events 2) | head -n 1)
  events $n | sed -n "/^${first%% *} /,\$p" >told.$n
  events 2 | sed -n "/^${first%% *} /,\$p" | head -n "$(wc -l <told.$n)" >expected.$n
  [ -s told.$n ] && cmp told.$n expected.$n || die "member $n was told another history than member 2"
done

# Corosync dies under a living daemon, and is started again.
: >gsd2.log
"$cluster" kill 2
await DIED_HORRIBLY member2.log
for n in 5 6; do await "2 has failed" member$n.log; done
"$cluster" start 2
await "info serving" gsd2.log
member 2 7
for n in 5 6 7; do await "members: 5 6 7" member$n.log; done

kill "${daemon[@]}"
for d in "${daemon[@]}"; do wait "$d" || die "a daemon ended with status $?"; done
echo "one history"
