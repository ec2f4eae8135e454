#!/bin/sh
# The package on a real service manager: boots systemd as PID 1 of namespaces
# of its own (tests/system/boot.sh), installs the .deb given as $1 with the
# demo product in /opt/torvad, and checks what an operator sees through
# systemctl and journalctl. Ends with "N passed, N failed"; exit 1 on a failure,
# and a manager that can't boot is a failure.
#   tests/system/run.sh build/torvad_1.1.21.0_amd64.deb build/demo_core
set -u
deb=$(realpath "$1") demo_core=$(realpath "$2")
here=$(dirname "$(realpath "$0")")
demo=$here/../../examples/demo
passed=0 failed=0

check() { # description, then a command that must succeed
    what=$1
    shift
    if "$@" >/dev/null 2>&1; then
        passed=$((passed + 1))
        echo "ok   $what"
    else
        failed=$((failed + 1))
        echo "FAIL $what"
    fi
}

# Waits up to $1 seconds for a command to succeed; no fixed sleeps elsewhere.
within() {
    limit=$(($(date +%s) + $1))
    shift
    until "$@" >/dev/null 2>&1; do
        [ "$(date +%s)" -lt "$limit" ] || return 1
        sleep 0.2
    done
}

base=$(mktemp -d /tmp/torvad-system.XXXXXX)
cgroup=/sys/fs/cgroup/unified/$(basename "$base")
[ -d /sys/fs/cgroup/unified ] || cgroup=/sys/fs/cgroup/$(basename "$base")
unshare --pid --fork --mount --net --propagation private "$here/boot.sh" "$base" "$cgroup" \
    >"$base.log" 2>&1 &
outer=$!
cleanup() {
    [ -n "${manager:-}" ] && kill -KILL "$manager" 2>/dev/null
    wait "$outer" 2>/dev/null
    [ -d "$cgroup" ] && find "$cgroup" -depth -type d -exec rmdir {} \; 2>/dev/null
    rmdir "$base" 2>/dev/null
    rm -f "$base.log"
}
trap cleanup EXIT

manager=
find_manager() {
    manager=$(cat "/proc/$outer/task/$outer/children" 2>/dev/null | tr -d ' ')
    [ -n "$manager" ] && [ "$(cat "/proc/$manager/comm")" = systemd ]
}
inside() { nsenter -t "$manager" -p -m -n -r -w "$@"; }
running() { inside systemctl is-system-running | grep -qx running; }
prop() { inside systemctl show -P "$2" "$1"; }
is() { [ "$(prop "$1" "$2")" = "$3" ]; }
journal_has() { inside journalctl --no-pager -u torvad | grep -qF -- "$1"; }
cores() { inside pgrep -cx core; }
one_core() { [ "$(cores)" = 1 ]; }
no_core() { ! inside pgrep -x core; }
mentions() { inside journalctl --no-pager -u torvad | grep -cF -- "$1"; }
stopped_clean() { is torvad ActiveState inactive && no_core; }
restarted() { is torvad ActiveState active && ! is torvad MainPID "$1" && ! is torvad MainPID 0; }
new_core() { [ "$(inside pgrep -x core)" != "$1" ] && one_core; }
# After the hand-over: the unit's main process is core itself, past its start.
runs_core() {
    is torvad ActiveState active && is torvad SubState running &&
        prop torvad ExecStart | grep -q "path=/opt/torvad/core "
}

start=$(date +%s)
if ! within 30 find_manager || ! within 30 running; then
    cat "$base.log"
    echo "FAIL systemd boots in namespaces of its own"
    echo "0 passed, 1 failed"
    exit 1
fi
echo "ok   systemd boots in namespaces of its own ($(($(date +%s) - start)) s)"
passed=1
# The hand-over's core must outlive the start timeout; a short one keeps the
# wait short. It is the manager's default, not the unit's.
inside sh -c 'mkdir -p /etc/systemd/system.conf.d &&
    printf "[Manager]\nDefaultTimeoutStartSec=4s\n" > /etc/systemd/system.conf.d/start.conf' &&
    inside systemctl daemon-reexec

# The checkout may lie where the guest has a tmpfs of its own (/tmp, /run),
# so what it needs goes in through a pipe.
stage=/var/tmp/torvad-system-test
inside mkdir -p "$stage"
tar -cf - -C "$(dirname "$deb")" "$(basename "$deb")" -C "$(dirname "$demo_core")" \
    "$(basename "$demo_core")" -C "$demo" exec.patterns scripts bin/powershell |
    inside tar -xf - -C "$stage"
check "the package installs" inside dpkg -i "$stage/$(basename "$deb")"
inside sh -c "cp '$stage/$(basename "$demo_core")' /opt/torvad/core &&
    cp -r '$stage/exec.patterns' '$stage/scripts' /opt/torvad/ &&
    cp '$stage/bin/powershell' /usr/local/bin/"
check "enable --now" inside systemctl enable --now torvad
check "active once ready" is torvad ActiveState active
check "the status names the running child" within 10 is torvad StatusText "running, 1 child"
check "the journal shows the demo's restart" within 10 journal_has "starting 'core' again."
check "the journal shows a relayed output" within 10 journal_has "core: 'uname -sr' says: Linux"
check "the journal shows a refusal" journal_has "core: 'cat /etc/shadow' refused with status 13"

stops_before=$(mentions "core: asked to stop, ending cleanly")
inside systemctl stop torvad
check "stop: core ends through sigterm" \
    test "$(mentions "core: asked to stop, ending cleanly")" -gt "$stops_before"
check "stop: core exits with 0" journal_has "'core' exited with 0x0."
check "stop: the result is success" is torvad Result success
check "stop: nothing of it is left" stopped_clean

inside systemctl start torvad
within 10 one_core
old=$(prop torvad MainPID)
inside systemctl restart torvad
check "restart: a new torvad" restarted "$old"
check "restart: one core" within 10 one_core

old=$(prop torvad MainPID) old_core=$(inside pgrep -x core)
inside kill -9 "$old"
check "kill -9: the unit starts torvad again" within 15 restarted "$old"
check "kill -9: one core, a new one" within 10 new_core "$old_core"

# The init script waits until the stop has been asked for.
inside systemctl stop torvad
inside sh -c 'cd /opt/torvad/scripts && mv init.ps1 init.kept &&
    printf "touch /run/init-running\nwhile [ ! -e /run/init-go ]; do sleep 0.1; done\nid -un\n" \
        > init.ps1'
stops_before=$(mentions "core: asked to stop, ending cleanly")
inside systemctl start --no-block torvad
within 10 inside test -e /run/init-running
inside systemctl stop --no-block torvad
inside touch /run/init-go
check "a stop during the init script: the run ends" within 20 stopped_clean
check "a stop during the init script: core ends through sigterm" \
    test "$(mentions "core: asked to stop, ending cleanly")" -gt "$stops_before"
check "a stop during the init script: the result is success" is torvad Result success
inside sh -c 'cd /opt/torvad/scripts && mv init.kept init.ps1'

# A core that knows nothing of torvad: usage text on -h, then it just runs.
inside sh -c 'rm -f /opt/torvad/core && printf "%s\n" "#!/bin/sh" \
    "[ \"\$1\" = -h ] && { echo usage: core >&2; exit 0; }" "exec sleep infinity" \
    > /opt/torvad/core && chmod 755 /opt/torvad/core'
# All the starts above count against the manager's start limit.
inside systemctl reset-failed torvad
inside systemctl start torvad 2>/dev/null
check "hand-over: torvad exits with 1" is torvad ExecMainStatus 1
check "hand-over: within 15 s the service runs core directly" within 15 runs_core
main=$(prop torvad MainPID)
sleep 6 # past the start timeout of 4 s: the point is that nothing happens
check "hand-over: core is still active (running) past the start timeout" runs_core
check "hand-over: the same core, never restarted" sh -c "[ $main != 0 ] && [ \"\$(nsenter -t $manager -p -m -n -r -w systemctl show -P MainPID torvad)\" = $main ]"
check "hand-over: the job's unit files stay valid" \
    sh -c "! nsenter -t $manager -p -m -n -r -w journalctl --no-pager | grep -q \"Missing '='\""

check "removal: the package goes" inside dpkg -r torvad
check "removal: the service is stopped" within 10 sh -c \
    "! nsenter -t $manager -p -m -n -r -w pgrep -f 'torvad|sleep infinity'"
check "removal: no unit is left" is torvad LoadState not-found
check "removal: no alias is left" inside test ! -L /etc/systemd/system/torvaSentryServer.service

echo "$passed passed, $failed failed ($(($(date +%s) - start)) s)"
[ "$failed" -eq 0 ]
