#!/bin/bash
# A plain web server that stays up: run this as often as you like, on one host. The first serves; when it is killed,
# stops or hangs, the next one does. gsctl itself starts it again with "serve".
#
#   web_server.sh FOLDER PORT
set -eu
if [ "${1:-}" != serve ]; then
  exec gsctl lead "web-${2:?usage: web_server.sh FOLDER PORT}" --restart --responsive 2 --grace 2 -- "$0" serve "$1" "$2"
fi

# What is served says which leader serves it. A leader with a smaller number than that must not write any more.
exec 9>>"$2/.leader"
flock 9
[ "$GS_FENCE" -ge "$(tail -n 1 "$2/.leader" | cut -d' ' -f1 | grep . || echo 0)" ] || exit 1
echo "$GS_FENCE $GS_MEMBER $$" >&9
exec 9>&-
exec python3 -m http.server --bind 127.0.0.1 --directory "$2" "$3"
