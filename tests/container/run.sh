#!/bin/sh
# The image of `make image` under podman with runc, on a store of the test's own
# where every podman command shares one mount namespace (podman.sh --enter), and
# the Kubernetes manifest through `podman kube play`. Leaves nothing behind.
#   tests/container/run.sh build/torvad-image.tar deploy/kubernetes/torvad.yaml
set -u
archive=$(realpath "$1") manifest=$(realpath "$2")
here=$(dirname "$(realpath "$0")")
. "$here/../lib.sh"
podman_sh=$here/../../packaging/container/podman.sh
[ -n "${TORVAD_PODMAN_STORE:-}" ] || exec "$podman_sh" --enter "$(mktemp -d /tmp/torvad-container.XXXXXX)" "$0" "$@"
store=$TORVAD_PODMAN_STORE && touch "$store/started"
parents='/sys/fs/cgroup/libpod_parent /sys/fs/cgroup/*/libpod_parent' # cgroups v2, v1
ls -d $parents >/dev/null 2>&1 && cgroups= || cgroups=ours # if podman made them, they go at the end
p() { "$podman_sh" "$store" "$@"; }
cleanup() {
    [ -n "${listener:-}" ] && kill "$listener" 2>/dev/null
    { p kube down "$manifest"; p rm -af -t 0; p system reset -f; } >/dev/null 2>&1
    tidy_cgroups; rm -rf "$store"
}
tidy_cgroups() { # podman leaves even removed pods' cgroups: those made since the start go
    find $parents -mindepth 1 -depth -type d -newer "$store/started" -exec rmdir {} \; 2>/dev/null
    [ -z "$cgroups" ] || rmdir $parents 2>/dev/null; }
trap cleanup EXIT
logs_have() { p logs "$1" 2>&1 | grep -qF -- "$2"; }
cores() { p top "$1" "${2:-pid}" comm | awk '$2 == "core" { print $1 }'; }
one_core() { [ "$(cores "$1" | wc -l)" = 1 ]; }
one_new_core() { one_core demo && [ "$(cores demo)" != "$1" ]; }
refusals() { [ "$(p logs "${2:-demo}" 2>&1 | grep -c 'refused with status 13')" = "$1" ]; }
as_nobody() { p top "$1" user comm | awk 'NR > 1 && $1 != "nobody" { bad = 1 } $2 == "core" { core = 1 } END { exit bad || !core }'; }
untouched() { # the machine's files as its first process sees them, outside the namespace,
    tidy_cgroups # and no cgroup left (conmon's, if the machine has one, is written to, not made)
    [ -z "$({ cd /proc/1/root && find var/lib/containers run/containers run/libpod etc/containers \
        etc/cni -newer "$store/started"; find $parents -type d -newer "$store/started"; } 2>/dev/null)" ]
}
orphans_with_torvad() { p top demo ppid comm | grep -q '^1 *busybox'; }
no_zombie_no_orphan() { ! p top demo state comm | grep -Eq '^Z|busybox'; }
ordered_stop() { # what an orderly end through sigterm leaves
    logs_have "$1" "stopping torvad version" && logs_have "$1" "core: asked to stop, ending cleanly" &&
        logs_have "$1" "'core' exited with 0x0." && [ "$(p inspect -f '{{.State.ExitCode}}' "$1")" = 0 ]
}

image=$(tar -xOf "$archive" index.json | sed -n 's/.*"org.opencontainers.image.ref.name":"\([^"]*\)".*/\1/p')
p load -q -i "$archive" >/dev/null && p run --rm "$image" -h 2>&1 | grep -q "torvad version" ||
    give_up "podman loads and runs the image"
check "podman loads and runs $image" true

# READY=1 reaches the caller's NOTIFY_SOCKET only through torvad. At that moment
# the listener notes each core's grandparent: conmon, for a core run by the
# container's own first process.
perl -MSocket -e 'socket(S, PF_UNIX, SOCK_DGRAM, 0) && bind(S, pack_sockaddr_un($ARGV[0])) || die;
    sub proc { open(my $f, "/proc/$_[0]/$_[1]") or return ""; local $/; <$f> }
    sub parent { (split / /, proc($_[0], "stat") =~ s/.*\) //sr)[1] }
    $| = 1;
    while (defined recv(S, $m, 4096, 0)) {
        next unless $m =~ /^READY=1$/m;
        @cores = grep { proc($_, "comm") eq "core\n" } map { s|/proc/||r } glob "/proc/[0-9]*";
        print join(" ", "READY=1, cores under", map { parent(parent($_)) } @cores), " \n";
    }' "$store/notify" >"$store/notify.log" &
listener=$!
within 5 test -S "$store/notify"
# On a read-only root the demo's core can't leave its marker and doesn't fail
# once: the core that READY=1 follows is the one that stays. With -r, READY=1
# waits for core's own word.
NOTIFY_SOCKET=$store/notify p run -d --name ready --read-only --sdnotify=container "$image" -r \
    >/dev/null
conmon=$(p inspect -f '{{.State.ConmonPid}}' ready)
check "sdnotify=container: READY=1 comes once core runs" within 10 grep -q "^READY=1.* $conmon " "$store/notify.log"
check "-r: READY=1 follows core's ready" logs_have ready "the product is ready."
check "torvad-wrap runs a program in the image" \
    test "$(p run --rm "$image" -o -- torvad-wrap busybox echo wrapped 2>&1 | grep -c wrapped)" = 1
p run -d --name demo "$image" >/dev/null
check "podman logs show a relayed output" within 10 logs_have demo "core: 'uname -sr' says: Linux"
check "podman logs show the two refusals" within 10 refusals 2

# Orphans of a burst come to torvad as PID 1, which reaps them all.
p exec demo sh -c 'i=0; while [ $i -lt 50 ]; do sh -c "busybox sleep 2 &"; i=$((i + 1)); done'
check "a burst of orphans goes to torvad" orphans_with_torvad
check "no zombie is left after the burst" within 10 no_zombie_no_orphan

old=$(cores demo)
kill -9 "$(cores demo hpid)"
check "kill -9 of core: one new core" within 10 one_new_core "$old"
p stop -t 10 demo >/dev/null
check "podman stop: core ends through sigterm, exit 0" ordered_stop demo

# A broken image ends, or goes on closed, and says why: never a silent hang.
timeout 30 "$podman_sh" "$store" run --name empty --tmpfs /opt/torvad:notmpcopyup "$image" >/dev/null 2>&1
check "no core: the run ends by itself (exit $?)" logs_have empty "stopping torvad version"
cp "$here/../../examples/demo/exec.patterns" "$store/patterns" && chmod 000 "$store/patterns"
p run -d --name closed --cap-drop DAC_OVERRIDE,DAC_READ_SEARCH \
    -v "$store/patterns:/opt/torvad/exec.patterns:ro" "$image" >/dev/null
check "unreadable exec.patterns: said in the log" within 10 logs_have closed "failed to open patterns file 'exec.patterns'"
check "unreadable exec.patterns: every request refused" within 10 refusals 3 closed
p stop -t 10 closed >/dev/null
check "unreadable exec.patterns: the stop is still orderly" ordered_stop closed

# Stopped the way the kubelet stops a pod: SIGTERM, and SIGKILL only after the
# grace period (podman's `kube down` alone kills at once). No network: on its
# default one, netavark would set the machine's ip_forward.
grace=$(sed -n 's/^ *terminationGracePeriodSeconds: *\([0-9]*\).*/\1/p' "$manifest")
check "kube play runs the manifest unchanged" p kube play --network none "$manifest"
pod=$(p pod ps -q)
ctr=$(p ps --filter "pod=$pod" --format '{{.Names}}' | grep -v -- -infra)
check "kube: core runs, relayed as before" within 10 logs_have "$ctr" "core: 'uname -sr' says: Linux"
check "kube: torvad and core run as nobody" as_nobody "$ctr"
check "kube: on a read-only root" test "$(p inspect -f '{{.HostConfig.ReadonlyRootfs}}' "$ctr")" = true
p pod stop -t "$grace" "$pod" >/dev/null
check "kube: core ends through sigterm, exit 0, within ${grace} s" ordered_stop "$ctr"
check "kube down removes the pod" p kube down "$manifest"

p rm -f -t 0 ready demo empty closed >/dev/null 2>&1 && p rmi -af >/dev/null 2>&1
check "the machine's own podman store and cgroups are as they were" untouched
summary
