#!/bin/sh
# PID 1 of fresh PID, mount and network namespaces (see run.sh): becomes systemd
# over a throw-away overlay of / in $1, in a cgroup of its own ($2) that a cgroup
# namespace makes its root, so nothing it mounts, cleans or starts reaches the machine.
set -e
base=$1 cgroup=$2 root=$1/root
mount -t tmpfs tmpfs "$base"
mkdir "$base/upper" "$base/work" "$root"
mount -t overlay overlay -o "lowerdir=/,upperdir=$base/upper,workdir=$base/work" "$root"
mount -t proc proc "$root/proc"
mount --bind /sys "$root/sys"
mount --rbind /dev "$root/dev"
for dir in run tmp; do mount -t tmpfs tmpfs "$root/$dir"; done
mkdir "$cgroup" && echo 0 > "$cgroup/cgroup.procs"
# No database servers, no login prompts on the machine's terminals.
rm -f "$root"/etc/systemd/system/*.wants/postgresql* "$root"/etc/systemd/system/*.wants/redis*
for unit in getty.target console-getty.service getty@.service serial-getty@.service \
    container-getty@.service; do ln -sf /dev/null "$root/etc/systemd/system/$unit"; done
export container=other
exec unshare --cgroup sh -c 'mount -t cgroup2 cgroup2 "$1/sys/fs/cgroup" && exec chroot "$1" /lib/systemd/systemd --system' sh "$root"
