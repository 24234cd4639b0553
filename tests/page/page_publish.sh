#!/bin/bash
# What the vendor publishes while the page test runs, on the demo's site and signed with
# its key (both made by scripts/demo/appliance.sh in the sandbox):
#   page_publish.sh BUILD_DIR reboot-fix   fix 3 of build 5644, which needs a reboot: a
#                                          package staged for the next boot
#   page_publish.sh BUILD_DIR release      release 5.2-5700, an 8 MiB image
set -euo pipefail
BUILD=$1
SITE=/srv/kyto-demo
WORK=/tmp/kyto-demo
KYTOSITE=$BUILD/tools/kytosite

deb() { # $1 name, $2 version, $3 folder whose files the package carries
    mkdir -p "$3/DEBIAN"
    printf 'Package: %s\nVersion: %s\nArchitecture: all\nMaintainer: Demo <demo@example.invalid>\nDescription: sample package %s\n' \
        "$1" "$2" "$1" >"$3/DEBIAN/control"
    dpkg-deb --root-owner-group -Zgzip --build "$3" "$WORK/debs/${1}_${2}_all.deb" >/dev/null
    rm -rf "$3"
}

case ${2:-} in
reboot-fix)
    stage=$(mktemp -d)
    # The small-update package carries the installer that runs at the next boot.
    mkdir -p "$stage/smallupd@ter"
    printf '#!/bin/sh\necho boot-time install\n' >"$stage/smallupd@ter/install.sh"
    chmod 0755 "$stage/smallupd@ter/install.sh"
    deb kyto-smallupdate 5.2-5644-s3 "$stage"
    stage=$(mktemp -d)
    mkdir -p "$stage/usr/share/kyto-demo-kernel"
    echo "kyto-demo-kernel 1.0-5644-s3" >"$stage/usr/share/kyto-demo-kernel/VERSION"
    deb kyto-demo-kernel 1.0-5644-s3 "$stage"
    cd "$WORK/debs"
    "$KYTOSITE" fix $SITE --build 5644 --model demo_model --fix 3 --reboot \
        --smallupdate kyto-smallupdate_5.2-5644-s3_all.deb kyto-demo-kernel_1.0-5644-s3_all.deb
    ;;
release)
    head -c 8M /dev/urandom >"$WORK/VYX_5.2-5700.img"
    "$KYTOSITE" release $SITE "$WORK/VYX_5.2-5700.img" --version 5.2-5700 --model demo_model
    ;;
*)
    echo "usage: page_publish.sh BUILD_DIR reboot-fix|release" >&2
    exit 64
    ;;
esac
"$KYTOSITE" sign $SITE --key "$WORK/keys/demo.key"
