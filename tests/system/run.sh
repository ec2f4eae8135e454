#!/bin/sh
# The .deb on a real systemd, booted as PID 1 of namespaces of its own (boot.sh),
# with the demo product in /opt/torvad, checked as an operator sees it.
#   tests/system/run.sh build/torvad_1.1.21.0_amd64.deb build/demo_core
set -u
deb=$(realpath "$1") demo_core=$(realpath "$2")
here=$(dirname "$(realpath "$0")")
demo=$here/../../examples/demo
. "$here/../lib.sh"

base=$(mktemp -d /tmp/torvad-system.XXXXXX)
cgroup=/sys/fs/cgroup/unified/$(basename "$base")
[ -d /sys/fs/cgroup/unified ] || cgroup=/sys/fs/cgroup/$(basename "$base")
unshare --pid --fork --mount --net --propagation private "$here/boot.sh" "$base" "$cgroup" \
    >"$base.log" 2>&1 &
outer=$! manager=
cleanup() {
    [ -n "$manager" ] && kill -KILL "$manager" 2>/dev/null
    wait "$outer" 2>/dev/null
    [ -d "$cgroup" ] && find "$cgroup" -depth -type d -exec rmdir {} \; 2>/dev/null
    rmdir "$base" 2>/dev/null; rm -f "$base.log"
}
trap cleanup EXIT
find_manager() {
    manager=$(cat "/proc/$outer/task/$outer/children" 2>/dev/null | tr -d ' ')
    [ -n "$manager" ] && [ "$(cat "/proc/$manager/comm")" = systemd ]
}
inside() { nsenter -t "$manager" -p -m -n -r -w "$@"; }
# Files go in through a pipe: the checkout may lie where the guest has a tmpfs of its own.
put() { inside sh -c "mkdir -p ${1%/*} && rm -f $1 && cat > $1 && chmod 755 $1" <"$2"; }
prop() { inside systemctl show -P "$2" "$1"; }
is() { [ "$(prop "$1" "$2")" = "$3" ]; }
journal_has() { inside journalctl --no-pager -u torvad | grep -qF -- "$1"; }
sigterms() { inside journalctl --no-pager -u torvad | grep -cF "core: asked to stop, ending cleanly"; }
units_valid() { ! inside journalctl --no-pager | grep -q "Missing '='"; }
one_core() { [ "$(inside pgrep -cx core)" = 1 ]; }
stopped_clean() { is torvad ActiveState inactive && not inside pgrep -x core; }
restarted() { is torvad ActiveState active && ! is torvad MainPID "$1" && ! is torvad MainPID 0; }
new_core() { [ "$(inside pgrep -x core)" != "$1" ] && one_core; }
runs_core() { is torvad ActiveState active && is torvad SubState running &&
    prop torvad ExecStart | grep -q "path=/opt/torvad/core "; } # the hand-over's main process

start=$(date +%s)
within 30 find_manager && within 30 inside sh -c 'systemctl is-system-running | grep -qx running' ||
    { cat "$base.log"; give_up "systemd boots in namespaces of its own"; }
check "systemd boots in namespaces of its own ($(($(date +%s) - start)) s)" true
# The hand-over's core must outlive the start timeout, the manager's default:
# a short one keeps that wait short.
printf '[Manager]\nDefaultTimeoutStartSec=4s\n' | put /etc/systemd/system.conf.d/start.conf /dev/stdin &&
    inside systemctl daemon-reexec

put /var/tmp/torvad.deb "$deb"
check "the package installs" inside dpkg -i /var/tmp/torvad.deb
# Compiled on import, as root's python3 does, beside the file.
check "Debian's python3 finds the Python peer" \
    inside env -u PYTHONDONTWRITEBYTECODE /usr/bin/python3 -c "import torvad_peer"
# -l: each line is also a record of the system's log, of its level's priority,
# with torvad's name and pid, its text alone; without -l, none.
logged() { inside journalctl --no-pager -o verbose SYSLOG_IDENTIFIER=torvad SYSLOG_FACILITY=3 \
    PRIORITY="$1" MESSAGE="$2" | grep -c SYSLOG_PID=; }
for flag in -l -v; do inside script -qec "torvad $flag -p /no/such/dir/pid" /dev/null >/dev/null; done
check "-l: an error record" within 10 test "$(logged 3 "failed to create pid file")" = 1
check "-l: an information record" test "$(logged 6 "successfully started torvad version 1.1.21.0")" = 1
put /opt/torvad/core "$demo_core" && put /usr/local/bin/powershell "$demo/bin/powershell"
tar -cf - -C "$demo" exec.patterns scripts | inside tar -xf - --no-same-owner -C /opt/torvad
check "enable --now" inside systemctl enable --now torvad
check "active once ready" is torvad ActiveState active
check "the status names the running child" within 10 is torvad StatusText "running, 1 child"
check "the journal shows the demo's restart" within 10 journal_has "starting 'core' again."
check "the journal shows a relayed output" within 10 journal_has "core: 'uname -sr' says: Linux"
check "the journal shows a refusal" journal_has "core: 'cat /etc/shadow' refused with status 13"

before=$(sigterms)
inside systemctl stop torvad
check "stop: core ends through sigterm" test "$(sigterms)" -gt "$before"
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

# The stop is asked for while the init script still runs.
inside systemctl stop torvad
printf '%s\n' 'touch /run/init-running' 'while [ ! -e /run/init-go ]; do sleep 0.1; done' 'id -un' |
    put /opt/torvad/scripts/init.ps1 /dev/stdin
before=$(sigterms)
inside systemctl start --no-block torvad
within 10 inside test -e /run/init-running
inside systemctl stop --no-block torvad
inside touch /run/init-go
check "a stop during the init script: the run ends" within 20 stopped_clean
check "a stop during the init script: core ends through sigterm" test "$(sigterms)" -gt "$before"
check "a stop during the init script: the result is success" is torvad Result success
put /opt/torvad/scripts/init.ps1 "$demo/scripts/init.ps1"

# A core that knows nothing of torvad: usage text on -h, then it just runs.
printf '%s\n' '#!/bin/sh' '[ "$1" = -h ] && { echo usage: core >&2; exit 0; }' 'exec sleep infinity' |
    put /opt/torvad/core /dev/stdin
inside systemctl reset-failed torvad # all the starts above count against the start limit
inside systemctl start torvad 2>/dev/null
check "hand-over: torvad exits with 1" is torvad ExecMainStatus 1
check "hand-over: within 15 s the service runs core directly" within 15 runs_core
main=$(prop torvad MainPID)
sleep 6 # past the start timeout of 4 s: the point is that nothing happens
check "hand-over: core is still active (running) past the start timeout" runs_core
check "hand-over: the same core, never restarted" test "$main" != 0 -a "$(prop torvad MainPID)" = "$main"
check "hand-over: the job's unit files stay valid" units_valid

# A server nobody here wrote, under torvad-wrap and -r: the start returns once it
# serves, though it takes two seconds to begin; the stop is its own shutdown.
printf '%s\n' '[Service]' 'Type=notify' "ExecStart=torvad -r -- torvad-wrap sh -c 'sleep 2; \
exec redis-server --supervised systemd --port 6393 --save \"\" --appendonly no'" |
    put /etc/systemd/system/wrapped.service /dev/stdin
inside systemctl daemon-reload
check "a wrapped server: start returns once it serves" inside sh -c \
    'systemctl start wrapped && redis-cli -p 6393 ping | grep -qx PONG'
inside systemctl stop wrapped
check "a wrapped server: its stop is its own" within 10 inside sh -c \
    "journalctl --no-pager -u wrapped | grep -q 'bye bye'"
check "a wrapped server: it ends with 0" is wrapped Result success

check "removal: the package goes" inside dpkg -r torvad
check "removal: the service is stopped" within 10 not inside pgrep -f 'torvad|sleep infinity'
check "removal: no unit is left" is torvad LoadState not-found
check "removal: no alias is left" inside test ! -L /etc/systemd/system/torvaSentryServer.service
check "removal: no Python peer is left" test -z "$(inside find /usr/lib/python3 -name 'torvad_peer*')"
summary " ($(($(date +%s) - start)) s)"
