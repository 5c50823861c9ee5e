#!/bin/bash
# on_hosts.sh CLUSTER N COMMAND [ARG...]: runs COMMAND where there are N hosts, in a folder that goes away again; what it
# leaves there is shown if it fails. 77: this machine does not allow it.
set -u
cluster=$1 hosts=$2
shift 2
uidgid=$(realpath "$(dirname "$0")/../../packaging/corosync-uidgid")
why=$("$cluster" check) || { echo "skipped: $why"; exit 77; }
here=$(mktemp -d)
trap 'rm -rf "$here"' EXIT
chmod 755 "$here"
cd "$here" || exit 2
# What lets a daemon of another user use Corosync, for one that is on every machine.
sed 's/: gsd$/: 65534/' "$uidgid" >uidgid
UIDGID=$here/uidgid TOKEN=${TOKEN:-1000} WAIT=60 "$cluster" run "$hosts" "$@" </dev/null
status=$?
[ $status -eq 0 ] || tail -n 60 "$here"/*.log 2>/dev/null
exit $status
