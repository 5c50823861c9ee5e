#!/bin/bash
# commands.sh BIN: what get, set, send, expel, wait, watch and join do for groups, print, and end with.
. "$(dirname "$0")/daemon.sh"

# Wrong use, and no daemon: one line each.
expect 3 '^gsctl: no daemon at unix:.*start gsd' "$gsctl" get crew
start_gsd
expect 2 'GROUP is required' "$gsctl" get
expect 2 'at most 32 characters' "$gsctl" get "$(printf 'x%.0s' {1..33})"
expect 1 'there is no such group' "$gsctl" get crew
expect 1 'there is no such group' "$gsctl" --json set crew x
expect 4 'time is over' "$gsctl" wait crew --members 1 --timeout 0.1

# A watcher with a program, a member that obeys, and one that is asked by a program.
"$gsctl" watch crew --json >watch.log &
watch=$!
"$gsctl" watch crew --exec 'echo "$GS_CHANGE $GS_EVENT [$GS_WHO] [$GS_MEMBERS] $GS_WHY $(cat)"' >exec.log &
mkfifo orders
"$gsctl" join crew --instance 1 --name ann <orders >ann.log 2>&1 &
ann=$!
exec 9>orders
await_text 'joined 1/1; members: 1/1$' ann.log
expect 2 'at most 256 characters' "$gsctl" join crew --name "$(printf 'x%.0s' {1..257})"
expect 1 'instance number is taken' "$gsctl" join crew --instance 1
expect 2 'over the limit of 65536 bytes' "$gsctl" set crew "$(printf 'x%.0s' {1..65537})"
"$gsctl" join crew --instance 2 --json --vote-with '[ "$(cat)" != no ] || { echo "not by $GS_WHO"; exit 1; }' \
  </dev/null >ben.log &
ben=$!
expect 0 '"members":\[\{"instance":1,"node":1\},\{"instance":2,"node":1\}\]' "$gsctl" wait crew --members 2 --json
expect 0 '^1/1$' "$gsctl" wait crew --leader

# Values of any bytes, there and back; what a vote rejects, with its message.
expect 0 '^approved, event [0-9]+$' "$gsctl" set crew -- '-v'
expect 0 '^-v$' "$gsctl" get crew
printf 'a\0\xffb' | "$gsctl" set crew - >/dev/null || die "bytes"
"$gsctl" get crew | cmp - <(printf 'a\0\xffb') || die "other bytes"
expect 0 '^a..b$' "$gsctl" get --show crew
expect 0 '"length":4,"state_base64":"YQD/Yg=="' "$gsctl" get crew --json
expect 1 'rejected by gsctl \(2/1\): "not by [0-9]+/1"' "$gsctl" set crew no
expect 1 '"outcome":"rejected".*"by":\[\{"instance":2,"node":1,"name":"gsctl"\}\],"message":"not by ' "$gsctl" --json send crew no
printf 'nonsense\nstate no\nsay hello\nstate yes\n' >&9
expect 0 '' "$gsctl" wait crew --state yes
await_text 'message 1/1 "hello"' ann.log
has '"nonsense": say state TEXT' ann.log && has 'rejected 1/1 .*"not by 1/1"' ann.log || die "orders"
await_text '^state [0-9]+ \[1/1\] \[\]  yes$' exec.log

# Out of the group in each way, and why.
expect 1 'no such member' "$gsctl" expel crew 77/1
expect 2 "is no member's id" "$gsctl" expel crew one
expect 0 approved "$gsctl" expel crew 2
wait $ben && die "an expelled member ended well"
await_text '"change":"left".*"who":\[\{"instance":2,"node":1\}\],"why":"expelled"' watch.log
"$gsctl" join crew --instance 3 </dev/null >cid.log &
cid=$!
await "$gsctl" wait crew --members 2 --timeout 1
kill -KILL $cid
await_text '"instance":3,"node":1\}\],"why":"failed"' watch.log
"$gsctl" wait crew --gone &
gone=$!
echo leave >&9
wait $ann && wait $gone || die "leave"
await_text '"why":"left","members":\[\]' watch.log
await_text '"change":"ended"' watch.log

# The daemon goes and comes back: who watches stays, who is a member or waits ends.
"$gsctl" join other </dev/null >other.log 2>&1 &
other=$!
await_text joined other.log
"$gsctl" wait other --members 9 2>/dev/null &
waiting=$!
subscribed() { "$gsctl" groups --json | grep -q '"group":"other".*"subscribers":1'; }
await subscribed
kill -KILL $gsd
wait $other
[ $? -eq 5 ] || die "join without a daemon"
wait $waiting
[ $? -eq 5 ] || die "wait without a daemon"
await_text '"change":"lost"' watch.log
start_gsd
await_text '"change":"found"' watch.log
: >watch.log
"$gsctl" join crew --vote reject --name bob </dev/null >bob.log &
await_text '"change":"joined".*"members":\[\{' watch.log
expect 1 'rejected by bob' "$gsctl" set crew x

# Nobody reads any more: quiet, and at once; and nothing of others reaches a terminal as it is.
"$gsctl" watch crew | head -n 1 >/dev/null
[ "${PIPESTATUS[0]}" -eq 0 ] || die "a closed output"
"$gsctl" join crew <<<$'say \e[2Jx' >echo.log 2>&1 &
await_text 'rejected .*bob' bob.log
await_text '\?\[2Jx' echo.log
kill $watch
wait $watch || die "an interrupted watch"
