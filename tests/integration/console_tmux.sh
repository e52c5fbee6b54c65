#!/bin/sh
# A person at "qel console", played by tmux: types, uses the escape commands, resizes the window, suspends and resumes,
# pastes a mebibyte into a partition that does not read, and leaves servers that are stopped or dead; and at "qel status
# --watch". Waits for texts on the screen, never for a fixed time.
#
#   console_tmux.sh QEL
# shellcheck disable=SC2016 # what is typed is for the shells in the window
set -eu

qel=$1
work=$(mktemp -d)
server=""
touch "$work/empty"

person() { tmux -S "$work/socket" -f "$work/empty" "$@"; }

cleanup() {
    person kill-server 2>/dev/null || true
    if [ -n "$server" ]; then
        kill -CONT "$server" 2>/dev/null || true
        kill -KILL "$server" 2>/dev/null || true
    fi
    rm -rf "$work"
}
trap cleanup EXIT
trap 'exit 1' INT TERM

screen() { person capture-pane -p -J -t main; }

fail() {
    echo "console_tmux: FAILED: $*" >&2
    screen >&2 || true
    exit 1
}

# Waits until the screen has the text so many times.
await() {
    attempts=0
    while [ "$(screen | grep -c -F -e "$1")" -lt "${2:-1}" ]; do
        attempts=$((attempts + 1))
        [ "$attempts" -lt 1000 ] || fail "'$1' did not come"
        sleep 0.02
    done
}

# Waits until the shell of the partition has nothing more to say.
await_prompt() {
    attempts=0
    until [ "$(screen | sed '/^ *$/d' | tail -n 1 | tr -d ' ')" = 'guest>' ]; do
        attempts=$((attempts + 1))
        [ "$attempts" -lt 1000 ] || fail "the prompt did not come"
        sleep 0.02
    done
}

type_keys() { person send-keys -t main -l -- "$1"; }
enter() { person send-keys -t main Enter; }

# Leaves, and takes the time from the key to the shell's answer.
leave() {
    enter # the start of a line
    begin=$(date +%s%N)
    type_keys '~.'
    await "$1"
    taken=$((($(date +%s%N) - begin) / 1000000))
    echo "console_tmux: left $2 in $taken ms"
    [ "$taken" -lt 3000 ] || fail "leaving $2 took $taken ms"
}

start_server() {
    "$qel" serve --plain --listen 127.0.0.1:0 --status-socket "$work/status" --partition "1=PS1='guest> ' exec /bin/sh" \
        --partition '2=stty raw -echo; echo ready; exec sleep 1000' >"$work/address" 2>"$work/serve.log" &
    server=$!
    attempts=0
    until grep -q -o '127.0.0.1:[0-9]*' "$work/address" 2>/dev/null; do
        attempts=$((attempts + 1))
        [ "$attempts" -lt 1000 ] || fail "the server does not listen"
        sleep 0.02
    done
    address=$(grep -o '127.0.0.1:[0-9]*' "$work/address")
}

console() {
    person send-keys -R -t main # an empty screen
    person send-keys -t main -l -- "$qel console --plain --connect $address $*; echo shell \$?"
    person send-keys -t main Enter
}

start_server
person new-session -d -s main -x 100 -y 30 "PS1='host> ' /bin/sh -m"
await 'host> '

# Typing, and the commands after the escape character.
console 1
await 'guest> '
type_keys 'echo $((6 * 7))'
enter
await '42'
type_keys '~?'
await '~#   type a file'
type_keys '~i'
await 'bytes received'
type_keys '~t'
await 'time stamps in UTC'
type_keys 'echo stamped'
enter
await 'Z] stamped'
type_keys '~t'
await 'seconds since the line before'
type_keys '~t'
await 'time stamps off'

type_keys '~l'
await 'there is no log; start with --log FILE'
type_keys '~b'
await 'the protocol carries no break'
type_keys '~r'
await 'nothing that is typed is sent'
type_keys 'echo unseen'
enter
type_keys '~r'
await 'what is typed is sent again'
type_keys 'echo $((8 * 8))'
enter
await '64'
[ "$(screen | grep -c unseen)" -eq 0 ] || fail 'what was typed while it was read only was sent'
echo 'echo from the $((4 + 4))th file' >"$work/file"
type_keys '~#'
await 'file to type'
type_keys "$work/file"
enter
await 'from the 8th file'
await_prompt
prompts=$(screen | grep -c -F 'guest>')
enter
await 'guest>' $((prompts + 1)) # otherwise the echo may come before the prompt
type_keys '~~'
enter
await 'guest> ~'

# The window gets another size, and the partition is told.
person resize-window -t main -x 90 -y 40
type_keys '~w'
await 'stty rows 40 cols 90'
type_keys 'stty size'
enter
await '40 90'

# Suspend and resume.
type_keys '~'
person send-keys -t main C-z
await 'shell '
type_keys 'echo on the $((20 + 3))rd floor; fg'
enter
await 'on the 23rd floor'
type_keys 'echo back $((7 * 7))'
enter
await 'back 49'
leave 'left partition 1' 'a live server'

# A mebibyte is pasted into a partition that does not read.
console 2
await 'ready'
head -c 1048576 /dev/zero | tr '\0' 'x' >"$work/paste"
person load-buffer "$work/paste"
person paste-buffer -t main
await 'bytes of input are held back'
leave 'are thrown away' 'a partition that does not read'

# The status is drawn again and again, goes when the job is suspended, and comes back with it.
person send-keys -R -t main
type_keys "$qel status --socket $work/status --watch 0.1"
enter
await 'Partitions: 2'
await 'q leaves'
person send-keys -t main C-z
await 'Stopped'
[ "$(screen | grep -c -F 'q leaves')" -eq 0 ] || fail "the status is still on the screen"
type_keys 'stty -a | tr " " "\n" | grep -x -e icanon -e echo | sort | tr "\n" " "'
enter
await 'echo icanon'
type_keys 'fg'
enter
await 'q leaves'
type_keys 'q'
await 'Stopped' # the screen as it was
person send-keys -R -t main
type_keys 'echo gone; stty -a | tr " " "\n" | grep -x -e icanon -e echo | sort | tr "\n" " "'
enter
await 'echo icanon'

# The server is stopped.
console --keepalive 0.5 1
await 'connected to partition 1'
kill -STOP "$server"
await 'has sent nothing for 0.5 s'
leave 'left partition 1' 'a stopped server'
kill -CONT "$server"

# The server dies.
console 1
await 'connected to partition 1'
kill -KILL "$server"
await 'connection lost'
await 'shell 7'
type_keys 'stty -a | tr " " "\n" | grep -x -e icanon -e echo | sort | tr "\n" " "'
enter
await 'echo icanon' # the terminal is as it was
echo "console_tmux: passed"
