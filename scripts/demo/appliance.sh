#!/bin/bash
# The demo's appliance side, run by scripts/demo.sh inside the test sandbox
# (build/tests/kyto-sandbox): a disposable appliance root with its own loopback network,
# provisioned with version files, recording start-up scripts and a recording package
# control program.  The vendor's half first: kytosite makes the sample update site (two
# fixes of build 5644, packages built with dpkg-deb), signs it with a demo key made on the
# spot and checks it as an appliance would, served by nginx on 127.0.0.1.  Then kytoupdate,
# trusting that key, drives the small update as an administrator would, refuses a package
# altered on the server, and downloads release 5.2-5700 once it is published.  With --page,
# the appliance stops before the first check and serves the sample update page (page.sh)
# instead: COMMAND (the page test's browser driver) runs against it, or else it waits for
# Ctrl-C.
#   appliance.sh BUILD_DIR [--page [COMMAND ARGS...]]
set -euo pipefail
BUILD=$1
PAGE=0
if [ "${2:-}" = --page ]; then
    PAGE=1
    shift 2
fi
PAGE_PORT=8090
HERE=$(cd "$(dirname "$0")" && pwd)
KYTOUPDATE=$BUILD/tools/kytoupdate
KYTOSITE=$BUILD/tools/kytosite
PORT=8088
BASE=http://127.0.0.1:$PORT
SITE=/srv/kyto-demo
STATE=/run/kyto-demo-nginx
WORK=/tmp/kyto-demo # the vendor's packages, release image and demo key (the sandbox's /tmp)
DEBS=$WORK/debs
KEYS=$WORK/keys
TRUST=/etc/kytoupdate/trusted.d
IMAGE_MB=${KYTO_DEMO_IMAGE_MB:-96}
FIX=(--build 5644 --model demo_model)

if [ -t 1 ]; then B=$'\033[1m' C=$'\033[36m' N=$'\033[0m'; else B= C= N=; fi
say() { printf '\n%s== %s%s\n' "$B" "$*" "$N"; }
run() {
    printf '%s# %s%s\n' "$C" "${*#"$BUILD/tools/"}" "$N"
    "$@"
}
download() {
    printf '%s# kytoupdate download%s\n' "$C" "$N"
    "$KYTOUPDATE" download
}
stop_server() {
    local pid
    for pid in $STATE/nginx.pid /run/kyto-page/nginx.pid; do
        if [ -f $pid ]; then kill "$(cat $pid)" 2>/dev/null || true; fi
    done
}
trap stop_server EXIT
installed() { dpkg-query -W -f='${Status}' "$1" 2>/dev/null | grep -q 'install ok installed'; }

# A package whose files include a padding blob of KiB kibibytes, so that its download takes
# long enough to watch at the rate the server allows.
deb() { # $1 name, $2 version, $3 KiB of padding, $4 extra content: "configupdate" or ""
    local stage
    stage=$(mktemp -d)
    mkdir -p "$stage/DEBIAN" "$stage/usr/share/$1"
    cat >"$stage/DEBIAN/control" <<CTL
Package: $1
Version: $2
Architecture: all
Maintainer: Demo <demo@example.invalid>
Description: sample small-update package $1
CTL
    head -c $(($3 * 1024)) /dev/urandom >"$stage/usr/share/$1/payload.bin"
    echo "$1 $2" >"$stage/usr/share/$1/VERSION"
    if [ "$4" = configupdate ]; then
        # The configuration updater the apply unpacks and runs; it records its call.
        printf '#!/bin/sh\nprintf '\''configupdate %%s\\n'\'' "$*" >>/var/log/kyto-calls.log\n' \
            >"$stage/configupdate"
        chmod 0755 "$stage/configupdate"
    fi
    dpkg-deb --root-owner-group -Zgzip --build "$stage" "$DEBS/${1}_${2}_all.deb" >/dev/null
    rm -rf "$stage"
}

say "the vendor: packages built with dpkg-deb, published with kytosite as fixes 1 and 2"
mkdir -p $DEBS $KEYS
deb kyto-demo-fix 1.0-5644-s1 768 ""
deb kyto-smallupdate 5.2-5644-s1 64 configupdate
deb kyto-demo-tools 1.0-5644-s2 768 ""
deb kyto-smallupdate 5.2-5644-s2 256 configupdate
cd $DEBS # the vendor's packages, named below as they are here
ls | sed 's/^/  /'
run "$KYTOSITE" init $SITE --base-url $BASE
run "$KYTOSITE" fix $SITE "${FIX[@]}" --fix 1 --smallupdate kyto-smallupdate_5.2-5644-s1_all.deb \
    kyto-demo-fix_1.0-5644-s1_all.deb --restart-service S01iptables.sh
run "$KYTOSITE" fix $SITE "${FIX[@]}" --fix 2 --smallupdate kyto-smallupdate_5.2-5644-s2_all.deb \
    kyto-demo-tools_1.0-5644-s2_all.deb --config --restart-service S80samba.sh \
    --restart-package DemoApp

say "the vendor signs the site with a demo key made on the spot (no password, in $KEYS)"
run "$KYTOSITE" keygen $KEYS/demo.pub $KEYS/demo.key
run "$KYTOSITE" sign $SITE --key $KEYS/demo.key

say "sample update server: nginx on $BASE serving $SITE"
mkdir -p $STATE
sed -e "s|@SITE@|$SITE|; s|@PORT@|$PORT|; s|@STATE@|$STATE|g" \
    -e "s|@PKG_RATE@|${KYTO_DEMO_PKG_RATE:-600k}|; s|@IMG_RATE@|${KYTO_DEMO_IMG_RATE:-24m}|" \
    "$HERE/nginx.conf.in" >$STATE/nginx.conf
nginx -e $STATE/error.log -c $STATE/nginx.conf
(cd $SITE && find . -type f ! -name '*.minisig' | sort | while read -r f; do
    if [ -f "$f.minisig" ]; then echo "  ${f#./}  (+ .minisig)"; else echo "  ${f#./}"; fi
done)

say "the vendor checks the site as an appliance of model demo_model on VYX 5.2-5644 reads it"
run "$KYTOSITE" check $BASE "${FIX[@]}" --version 5.2 --trust $KEYS

say "appliance: VYX 5.2-5644, model demo_model, data volume /volume1, the demo key trusted"
mkdir -p /volume1
mount -t tmpfs -o size=1g kyto-demo-volume /volume1
# The appliance asks this server for the release feed and the patch list.
printf 'rss_server="%s/autoupdate/genRSS.php"\nsmall_info_path="%s/smallupdate"\n' $BASE $BASE \
    >>/etc.defaults/kytoinfo.conf
# A start-up script the update restarts, recording its calls like the provisioned ones.
cp /usr/kyto/etc/rc.d/S20samba.sh /usr/kyto/etc/rc.d/S80samba.sh
install -D -m 0644 $KEYS/demo.pub $TRUST/demo.pub
sed 's/^/  /' /etc.defaults/VERSION
echo "  $TRUST: $(ls $TRUST)"

if [ $PAGE -eq 1 ]; then
    say "the update page: nginx on http://127.0.0.1:$PAGE_PORT/ (fcgiwrap, kytoupdate-cgi)"
    "$HERE/page.sh" "$BUILD" $PAGE_PORT
    if [ $# -gt 0 ]; then
        "$@"
        exit
    fi
    # demo.sh --page brings the page to the host's loopback (page-forward.sh).
    while :; do sleep 3600; done
fi

say "is there an update?"
rc=0
run "$KYTOUPDATE" check || rc=$?
echo "(exit $rc)"

say "download it (the patch list and each package verified against the trusted key)"
download

say "status, as the interface's back end reads it"
run "$KYTOUPDATE" status --json

say "what the small update installs and restarts"
run "$KYTOUPDATE" plan

say "apply it (the downloaded packages verified again first)"
: >/var/log/kyto-calls.log
run "$KYTOUPDATE" apply
echo "services and programs called by the apply:"
sed 's/\t/ /g; s/^/  /' /var/log/kyto-calls.log
echo "installed packages:"
dpkg-query -W -f='  ${Package} ${Version} ${Status}\n' kyto-demo-fix kyto-demo-tools
echo "version file: $(grep smallfixnumber /etc.defaults/VERSION)"
run "$KYTOUPDATE" status

say "the vendor publishes fix 3 and signs it; then one byte of its package is changed on the server"
deb kyto-demo-extra 1.0-5644-s3 256 ""
deb kyto-smallupdate 5.2-5644-s3 64 ""
run "$KYTOSITE" fix $SITE "${FIX[@]}" --fix 3 --smallupdate kyto-smallupdate_5.2-5644-s3_all.deb \
    kyto-demo-extra_1.0-5644-s3_all.deb
run "$KYTOSITE" sign $SITE --key $KEYS/demo.key
altered=$SITE/smallupdate/5644/debs/kyto-demo-extra_1.0-5644-s3_all.deb
cp $altered $WORK/original.deb
at=$(($(stat -c %s $altered) / 2))
byte=$(od -An -tu1 -j $at -N1 $altered | tr -d ' ')
printf "\\$(printf %o $(((byte + 1) % 256)))" | dd of=$altered bs=1 seek=$at conv=notrunc status=none
echo "changed byte $at of ${altered#"$SITE/"} ($byte -> $(((byte + 1) % 256)))"

say "the appliance downloads fix 3: refused, nothing installed"
download_rc=0
download || download_rc=$?
echo "(exit $download_rc)"
echo "kyto-demo-extra: $(installed kyto-demo-extra && echo installed || echo 'not installed')"
echo "version file: $(grep smallfixnumber /etc.defaults/VERSION)"
echo "package folder: $(ls -d /volume1/@smallupd@te_deb 2>/dev/null || echo 'removed')"
echo "system log: $(grep -h 'kytoupdate.*refused' /var/log/sandbox.syslog | tail -n1)"
run "$KYTOUPDATE" status
echo "the vendor's check (at fix level 2) sees it too:"
check_rc=0
run "$KYTOSITE" check $BASE "${FIX[@]}" --version 5.2 --smallfix 2 --trust $KEYS || check_rc=$?
echo "(exit $check_rc)"
cp $WORK/original.deb $altered
echo "the server's copy of the package is restored (sign signs the files as they are)"

say "the vendor publishes release 5.2-5700 ($IMAGE_MB MiB image) and signs it"
head -c $((IMAGE_MB * 1048576)) /dev/urandom >$WORK/VYX_5.2-5700.img
run "$KYTOSITE" release $SITE $WORK/VYX_5.2-5700.img --version 5.2-5700 --model demo_model
run "$KYTOSITE" sign $SITE --key $KEYS/demo.key
rm $WORK/VYX_5.2-5700.img
published=$(sed -n 's|.*<mCheckSum>\(.*\)</mCheckSum>.*|\1|p' $SITE/autoupdate/genRSS.php | head -n1)
run "$KYTOUPDATE" check
download
info=$(cat /autoupd@te.info)
echo "info file for the installer: $info"
image=$(sed -n 's/.*"patchPath":"\([^"]*\)".*/\1/p' /autoupd@te.info)
downloaded=$(md5sum <"$image" | cut -d' ' -f1)
echo "downloaded image:      $downloaded  $image"
echo "MD5 in the signed feed: $published"

say "result"
ok=1
for p in kyto-demo-fix kyto-demo-tools; do
    installed $p || { echo "FAIL: $p not installed"; ok=0; }
done
grep -q '^smallfixnumber="\?2"\?$' /etc.defaults/VERSION || { echo "FAIL: smallfixnumber is not 2"; ok=0; }
[ $download_rc -eq 5 ] || { echo "FAIL: the altered package's download exited $download_rc"; ok=0; }
! installed kyto-demo-extra || { echo "FAIL: the altered package was installed"; ok=0; }
[ -n "$published" ] && [ "$downloaded" = "$published" ] || { echo "FAIL: image MD5 differs"; ok=0; }
if [ $ok -eq 1 ]; then
    echo "small update 2 verified and installed (kyto-demo-fix, kyto-demo-tools in the dpkg" \
        "database, smallfixnumber=2); fix 3 with an altered package refused (exit 5), nothing" \
        "installed; release 5.2-5700 verified and downloaded"
fi
[ $ok -eq 1 ]
