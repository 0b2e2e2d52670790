#!/bin/sh
# unshare.sh MEDIAHOST OXSCRIPT SCRIPT: starts the host, and with it a script server, in a network of
# its own that a wire joins with ours, and runs the script here. With no arguments: can that be?
set -eu
if [ $# -eq 0 ]; then
    unshare -rn sh -c 'unshare -n true && ip link add near type veth peer name far'
    exit
fi
if [ "${KORVEL_INSIDE:-}" != yes ]; then
    export KORVEL_INSIDE=yes
    exec unshare -rn "$0" "$@"
fi

folder=$(mktemp -d)
host=
end() {
    [ -z "$host" ] || kill "$host" 2>/dev/null || :
    wait
    rm -rf "$folder"
}
trap end EXIT
mkfifo "$folder/is-apart" "$folder/is-joined" "$folder/port"

ip link set lo up
ip link add near type veth peer name far
# shellcheck disable=SC2016
unshare -n sh -c '
    echo >"$1/is-apart"
    read -r _ <"$1/is-joined"
    ip link set lo up
    ip address add 10.77.0.2/24 broadcast + dev far
    ip link set far up
    exec "$2" >"$1/port"
' - "$folder" "$1" &
host=$!
read -r _ <"$folder/is-apart"
ip link set far netns "$host"
ip address add 10.77.0.1/24 broadcast + dev near
ip link set near up
ip route add 255.255.255.255 dev near
echo >"$folder/is-joined"
read -r port <"$folder/port"
"$2" "$3" "$port"
