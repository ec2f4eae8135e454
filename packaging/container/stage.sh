#!/bin/sh
# Lays out the image's root in $2 from the build in $1: torvad, torvad-wrap
# and the demo's core, stripped, the shared libraries they load (the paths ldd
# gives, which are where the loader looks), the two accounts, and a static busybox for the
# tools the demo has run (uname, id) and the shell its stand-in interpreter is.
#   packaging/container/stage.sh build build/image-root
set -eu
build=$1 root=$2
source=$(dirname "$(realpath "$0")")/../..
rm -rf "$root"
mkdir -p "$root/usr/sbin" "$root/usr/bin" "$root/usr/local/bin" "$root/bin" "$root/etc" "$root/opt/torvad"
strip -o "$root/usr/sbin/torvad" "$build/torvad"
strip -o "$root/usr/bin/torvad-wrap" "$build/torvad-wrap"
strip -o "$root/opt/torvad/core" "$build/demo_core"
ldd "$build/torvad" "$build/torvad-wrap" "$build/demo_core" |
    awk '/\(0x/ { for (i = 1; i <= NF; i++) if ($i ~ /^\//) print $i }' | sort -u |
    while read -r library; do
        mkdir -p "$root$(dirname "$library")"
        strip --strip-unneeded -o "$root$library" "$(realpath "$library")"
    done
cp /bin/busybox "$root/bin/busybox"
for applet in sh uname id; do ln -s busybox "$root/bin/$applet"; done
cp "$source/examples/demo/bin/powershell" "$root/usr/local/bin/powershell"
cp -r "$source/examples/demo/exec.patterns" "$source/examples/demo/scripts" "$root/opt/torvad/"
printf '%s\n' 'root:x:0:0:root:/root:/bin/sh' \
    'nobody:x:65534:65534:nobody:/nonexistent:/bin/false' >"$root/etc/passwd"
printf '%s\n' 'root:x:0:' 'nobody:x:65534:' >"$root/etc/group"
