#!/bin/sh
# podman on a storage folder of its own ($1), with the settings beside this
# script: images, containers, their state and temporary files all stay there.
#   packaging/container/podman.sh build/containers images
# Run as root, podman also writes outside its storage whatever it is told:
# image copies keep a cache of blob digests in /var/lib/containers/cache, and
# netavark its state in /run/containers. So podman runs in a mount namespace
# where /var/lib and /run are overlays whose changes go to STORE/changes; the
# machine's own stay as they were. A caller of many podman
# commands enters that namespace once, so that they all share it:
#   packaging/container/podman.sh --enter STORE COMMAND...
if [ "$1" = --enter ]; then
    store=$(realpath -m "$2") && shift 2
    exec unshare --mount --propagation private sh -ec '
        export TORVAD_PODMAN_STORE="$1" && shift
        changes=$TORVAD_PODMAN_STORE/changes
        for dir in /var/lib /run; do
            mkdir -p "$changes$dir/upper" "$changes$dir/work"
            mount -t overlay overlay \
                -o "lowerdir=$dir,upperdir=$changes$dir/upper,workdir=$changes$dir/work" "$dir"
        done
        exec "$@"' sh "$store" "$@"
fi
store=$(realpath -m "$1")
shift
[ "${TORVAD_PODMAN_STORE:-}" = "$store" ] || exec "$0" --enter "$store" "$0" "$store" "$@"
mkdir -p "$store/tmp"
export CONTAINERS_CONF="$(dirname "$(realpath "$0")")/containers.conf" TMPDIR="$store/tmp"
exec podman --root "$store/root" --runroot "$store/run" --tmpdir "$store/libpod" \
    --network-config-dir "$store/networks" "$@"
