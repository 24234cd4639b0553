#!/bin/bash
# The demo's appliance side, run by scripts/demo.sh inside the test sandbox
# (build/tests/kyto-sandbox): a disposable appliance root with its own loopback network,
# provisioned with version files, recording start-up scripts and a recording package
# control program.  Starts the sample update server (nginx on 127.0.0.1), then drives a
# small update and a full release with kytoupdate as an administrator would.
#   appliance.sh BUILD_DIR
set -euo pipefail
BUILD=$1
HERE=$(cd "$(dirname "$0")" && pwd)
KYTOUPDATE=$BUILD/tools/kytoupdate
PORT=8088
BASE=http://127.0.0.1:$PORT
SITE=/srv/kyto-demo
STATE=/run/kyto-demo-nginx
IMAGE_MB=${KYTO_DEMO_IMAGE_MB:-96}

if [ -t 1 ]; then B=$'\033[1m' C=$'\033[36m' N=$'\033[0m'; else B= C= N=; fi
say() { printf '\n%s== %s%s\n' "$B" "$*" "$N"; }
run() {
    printf '%s# %s%s\n' "$C" "${*#"$BUILD/tools/"}" "$N"
    "$@"
}
stop_server() {
    if [ -f $STATE/nginx.pid ]; then kill "$(cat $STATE/nginx.pid)" 2>/dev/null || true; fi
}
trap stop_server EXIT

say "sample update server: nginx on $BASE, site in $SITE"
"$HERE/make_site.sh" $SITE $BASE feed-current
"$HERE/make_site.sh" $SITE $BASE patches
mkdir -p $STATE
sed -e "s|@SITE@|$SITE|; s|@PORT@|$PORT|; s|@STATE@|$STATE|g" \
    -e "s|@PKG_RATE@|${KYTO_DEMO_PKG_RATE:-600k}|; s|@IMG_RATE@|${KYTO_DEMO_IMG_RATE:-24m}|" \
    "$HERE/nginx.conf.in" >$STATE/nginx.conf
nginx -e $STATE/error.log -c $STATE/nginx.conf
(cd $SITE && find . -type f | sort | sed 's|^\./|  |')

say "appliance: VYX 5.2-5644, model demo_model, data volume /volume1"
mkdir -p /volume1
mount -t tmpfs -o size=1g kyto-demo-volume /volume1
# The appliance asks this server for the release feed and the patch list.
printf 'rss_server="%s/autoupdate/genRSS.php"\nsmall_info_path="%s/smallupdate"\n' $BASE $BASE \
    >>/etc.defaults/kytoinfo.conf
# A start-up script the update restarts, recording its calls like the provisioned ones.
cp /usr/kyto/etc/rc.d/S20samba.sh /usr/kyto/etc/rc.d/S80samba.sh
sed 's/^/  /' /etc.defaults/VERSION

say "is there an update?"
rc=0
run "$KYTOUPDATE" check || rc=$?
echo "(exit $rc)"

say "download it"
run "$KYTOUPDATE" download

say "status, as the interface's back end reads it"
run "$KYTOUPDATE" status --json

say "what the small update installs and restarts"
run "$KYTOUPDATE" plan

say "apply it"
: >/var/log/kyto-calls.log
run "$KYTOUPDATE" apply
echo "services and programs called by the apply:"
sed 's/\t/ /g; s/^/  /' /var/log/kyto-calls.log
echo "installed packages:"
dpkg-query -W -f='  ${Package} ${Version} ${Status}\n' kyto-demo-fix kyto-demo-tools
echo "version file: $(grep smallfixnumber /etc.defaults/VERSION)"
run "$KYTOUPDATE" status

say "the server publishes release 5.2-5700 ($IMAGE_MB MiB image)"
"$HERE/make_site.sh" $SITE $BASE feed-release "$IMAGE_MB"
run "$KYTOUPDATE" check
run "$KYTOUPDATE" download
info=$(cat /autoupd@te.info)
echo "info file for the installer: $info"
image=$(sed -n 's/.*"patchPath":"\([^"]*\)".*/\1/p' /autoupd@te.info)
echo "downloaded image: $(md5sum <"$image" | cut -d' ' -f1)  $image"
echo "published MD5:    $(cut -d' ' -f1 $SITE/images/VYX_5.2-5700.img.md5)"

say "result"
ok=1
for p in kyto-demo-fix kyto-demo-tools; do
    dpkg-query -W -f='${Status}' $p | grep -q 'install ok installed' || { echo "FAIL: $p not installed"; ok=0; }
done
grep -q '^smallfixnumber="\?2"\?$' /etc.defaults/VERSION || { echo "FAIL: smallfixnumber is not 2"; ok=0; }
cmp -s <(md5sum <"$image" | cut -d' ' -f1) <(cut -d' ' -f1 $SITE/images/VYX_5.2-5700.img.md5) ||
    { echo "FAIL: image checksum differs"; ok=0; }
if [ $ok -eq 1 ]; then
    echo "small update 2 installed (kyto-demo-fix, kyto-demo-tools in the dpkg database," \
        "smallfixnumber=2); release 5.2-5700 downloaded and verified"
fi
[ $ok -eq 1 ]
