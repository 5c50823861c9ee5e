#!/bin/bash
# faults.sh CLUSTER BIN N: a member on each of N hosts while hosts are cut off, hang, die and come back. Who stays must
# be told why others are gone, and all that anybody was told must be one history. To be run by on_hosts.sh.
set -u
cluster=$1 bin=$2 n=$3
declare -A daemon who                 # by host: process of gsd, number of the member
members=0
here=$(seq -s' ' 1 $((n / 2 + 1)))    # a majority, and the others
far=$(seq -s' ' $((n / 2 + 2)) "$n")

die() { echo "$*" >&2; exit 1; }

# await TEXT FILE: until a line of the file has the text.
await() {
  local end=$((SECONDS + 60))
  until grep -Eqs -- "$1" "$2"; do
    [ $SECONDS -lt $end ] || die "no \"$1\" in $2"
    sleep 0.05
  done
}

# The second host's daemon is another user, where a user can be had.
other=(setpriv --reuid 65534 --regid 65534 --clear-groups)
"${other[@]}" test -x "$bin/gsd" 2>/dev/null || { other=(); echo "all daemons run as root: no other user can be had"; }

ended() { # HOST STATUS: its daemon, so and in no other way
  wait "${daemon[$1]}" 2>/dev/null
  local status=$?
  [ $status -eq "$2" ] || die "the daemon of host $1 ended with status $status"
  unset "daemon[$1]"
}

start_daemon() { # HOST...: and waits until they serve
  local h as
  for h; do
    [ -z "${daemon[$h]:-}" ] || ended "$h" 137
    as=()
    [ "$h" != 2 ] || as=(${other[@]+"${other[@]}"})
    "$cluster" on "$h" install -d ${as[@]+-o 65534 -g 65534} /run/gsd
    "$cluster" on "$h" ${as[@]+"${as[@]}"} "$bin/gsd" --ordering corosync --member-timeout 2 >>"gsd$h.log" 2>&1 &
    daemon[$h]=$!
  done
  await_serving "$@"
}
await_serving() { # HOST...
  local h
  for h; do await "info serving" "gsd$h.log"; done
}

forget() { # HOST...: what the daemons have said so far is not waited for
  local h
  for h; do cat "gsd$h.log" >>"gsd$h.old"; : >"gsd$h.log"; done
}

join() { # HOST...: one more member on each; what is written into in.NUMBER are its commands
  local h
  for h; do
    who[$h]=$((++members))
    mkfifo "in.$members"
    "$cluster" on "$h" "$bin/member" crew $members <"in.$members" >"member$members.log" 2>>errors.log &
    eval "exec $((members + 10))>in.$members"
    await "$members joins" "member$members.log"
  done
}
tell() { echo "$2" >&$((who[$1] + 10)); } # HOST COMMAND
heard() { # TEXT HOST...: by the members of the hosts
  local text=$1 h
  shift
  for h; do await "$text" "member${who[$h]}.log"; done
}
told() { heard DIED_HORRIBLY "$@"; } # HOST...: that group services are gone

gone() { # LEAVE_CODE HOST...: the others are told so of the hosts' members, which count no more
  local code=$1 h lost=()
  shift
  for h; do
    lost+=("${who[$h]}")
    unset "who[$h]"
  done
  for h in "${lost[@]}"; do heard " $h [0-9 ]*has failed,( $code)+;" "${!who[@]}"; done
}

stop() { # HOST...
  local h
  for h; do kill "${daemon[$h]}"; done
  for h; do ended "$h" 0; done
}

start_daemon $here $far
join $here $far
tell 1 "state red"
heard 'the state is "red"' $here $far
"$cluster" on "$n" "$bin/gsctl" watch crew >watch.log 2>>errors.log &
watch=$!
await ' now "red"' watch.log

# Cut off: the others go on; who has no quorum is told, and not that the others have failed.
"$cluster" cut "${far// /,}"
told $far
for h in $far; do ! grep "has failed" "member${who[$h]}.log" || die "host $h has no quorum and told of failures"; done
forget $far
gone WYX_HOST_FAILURE $far
tell 1 "state blue"
heard 'the state is "blue"' $here
"$cluster" heal
await_serving $far
await ' now "blue"' watch.log
[ "$(grep -o ' \(now\|lost\|found\|left\) ' watch.log | tr -d '\n')" = " now  lost  found  now " ] ||
  die "who watches a host without quorum is told otherwise: $(cat watch.log)"
kill $watch
join $far

# A daemon that hangs is left out as soon as something waits for it; awake again, it tells its clients and comes back.
kill -STOP "${daemon[$n]}"
tell 1 "say on"
late=member${who[$n]}.log
gone WYX_HOST_FAILURE $n
forget $n
kill -CONT "${daemon[$n]}"
await DIED_HORRIBLY "$late"
await_serving $n
join $n

# A Corosync that hangs is a host that is gone; awake again, it finds the others gone on.
"$cluster" kill $n STOP
late=member${who[$n]}.log
gone WYX_HOST_FAILURE $n
forget $n
"$cluster" kill $n CONT
await DIED_HORRIBLY "$late"
await_serving $n
join $n

# A daemon dies, and with it its members; its host's next daemon takes the state from the others.
kill -KILL "${daemon[1]}"
told 1
forget 1
gone WYX_PROVIDER_FAILURE 1
start_daemon 1
join 1

# It ends in order, and so does that of another user.
stop 2
told 2
forget 2
gone WYX_HOST_LEAVE_DUE_TO_STOP 2
start_daemon 2
join 2

# Corosync dies under a living daemon, and is started again.
"$cluster" kill 2
told 2
forget 2
gone WYX_HOST_FAILURE 2
"$cluster" start 2
await_serving 2
join 2

# Whole hosts die at once, as many as the others can spare, and are started again.
"$cluster" crash "${far// /,}"
forget $far
gone WYX_HOST_FAILURE $far
"$cluster" start "${far// /,}"
start_daemon $far
join $far
tell $n "say all here"
heard 'says "all here"' $here $far
stop $here $far

! grep -l "Sanitizer\|runtime error" ./*.log ./*.old || die "a sanitizer has found something"

# One history: no number is two events, and nobody misses one between the first and the last that it was told. The first
# column is the time; who leads is told to one alone.
events() { grep -hv 'announcement\|leads$' "$@" | cut -d' ' -f2-; }
events member*.log | sort -n -u >all
twice=$(cut -d' ' -f1 all | uniq -d)
[ -z "$twice" ] || die "a number is two events: $(grep "^$twice " all)"
for m in $(seq $members); do
  events "member$m.log" >told
  awk 'NR == FNR { if (!first) first = $1; last = $1; next } $1 >= first && $1 <= last' told all | cmp - told ||
    die "member $m was not told what the others were"
done
echo "$members members on $n hosts, $(wc -l <all) events: one history"
