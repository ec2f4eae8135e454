#!/bin/sh
# podman on a storage folder of its own ($1), with the settings beside this
# script: images, containers, their state and temporary files all stay there.
#   packaging/container/podman.sh build/containers images
# Run as root, podman's image copies (save, load) also keep a cache of blob
# digests in /var/lib/containers/cache, whatever the storage: where the
# machine had no /var/lib/containers, it goes again afterwards.
store=$(realpath -m "$1")
shift
mkdir -p "$store/tmp"
[ -e /var/lib/containers ] && cache= || cache=/var/lib/containers/cache
CONTAINERS_CONF=$(dirname "$(realpath "$0")")/containers.conf TMPDIR=$store/tmp \
    podman --root "$store/root" --runroot "$store/run" --tmpdir "$store/libpod" \
    --network-config-dir "$store/networks" "$@"
status=$?
[ -n "$cache" ] && rm -f "$cache/blob-info-cache-v1.boltdb" &&
    rmdir "$cache" /var/lib/containers 2>/dev/null
exit $status
