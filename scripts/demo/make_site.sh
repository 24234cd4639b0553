#!/bin/sh
# Generates the sample update server's site:
#   make_site.sh SITE BASE_URL feed-current    release feed offering nothing newer than 5.2-5644
#   make_site.sh SITE BASE_URL feed-release MB release feed offering 5.2-5700, with an image of
#                                              MB MiB and its MD5 (images/VYX_5.2-5700.img[.md5])
#   make_site.sh SITE BASE_URL patches         patch list for build 5644 of model demo_model with
#                                              two fixes and their packages, built with dpkg-deb
# The feed is served as a plain file at the path the appliance asks for; its query is ignored.
set -eu
SITE=$1
BASE=$2
WHAT=$3
BUILD=5644
MODEL=demo_model

feed() { # $1: item build number, $2: model, $3: link, $4: MD5
    mkdir -p "$SITE/autoupdate"
    cat >"$SITE/autoupdate/genRSS.php" <<XML
<rss><channel>
<title>VYX releases</title>
<item>
<title>VYX 5.2-$1</title>
<MajorVer>5</MajorVer>
<MinorVer>2</MinorVer>
<BuildNum>$1</BuildNum>
<model>
<mUnique>$2</mUnique>
<mLink>$3</mLink>
<mCheckSum>$4</mCheckSum>
</model>
</item>
</channel></rss>
XML
}

# A package whose files include a padding blob of KiB kibibytes, so that its download takes
# long enough to watch at the rate the server allows.
deb() { # $1 name, $2 version, $3 KiB of padding, $4 extra control: "configupdate" or ""
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
        cat >"$stage/configupdate" <<'SH'
#!/bin/sh
printf 'configupdate %s\n' "$*" >>/var/log/kyto-calls.log
SH
        chmod 0755 "$stage/configupdate"
    fi
    dpkg-deb --root-owner-group -Zgzip --build "$stage" "$SITE/smallupdate/packages/${1}_${2}_all.deb" >/dev/null
    rm -rf "$stage"
}

case $WHAT in
feed-current)
    feed $BUILD $MODEL "$BASE/images/none.img" 0
    ;;
feed-release)
    mkdir -p "$SITE/images"
    img=$SITE/images/VYX_5.2-5700.img
    head -c $(($4 * 1048576)) /dev/urandom >"$img"
    md5=$(md5sum <"$img" | cut -d' ' -f1)
    echo "$md5  VYX_5.2-5700.img" >"$img.md5"
    feed 5700 $MODEL "$BASE/images/VYX_5.2-5700.img" "$md5"
    ;;
patches)
    mkdir -p "$SITE/smallupdate/packages" "$SITE/smallupdate/$BUILD/$MODEL"
    deb kyto-demo-fix "1.0-$BUILD-s1" 768 ""
    deb kyto-demo-tools "1.0-$BUILD-s2" 768 ""
    deb kyto-smallupdate "5.2-$BUILD-s2" 256 configupdate
    P=$BASE/smallupdate/packages
    cat >"$SITE/smallupdate/$BUILD/$MODEL/VYX-Security.json" <<JSON
{
  "vyxversion": $BUILD,
  "unique": "$MODEL",
  "smallupdate": [
    {
      "version": 1,
      "proj": [{"name": "kyto-demo-fix", "url": "$P/kyto-demo-fix_1.0-$BUILD-s1_all.deb"}],
      "flash_upgrade": false,
      "config_upgrade": false,
      "restart": {"vyx_service": ["S01iptables.sh"], "pkg": []}
    },
    {
      "version": 2,
      "proj": [{"name": "kyto-demo-tools", "url": "$P/kyto-demo-tools_1.0-$BUILD-s2_all.deb"},
               {"name": "smallupdate", "url": "$P/kyto-smallupdate_5.2-$BUILD-s2_all.deb"}],
      "flash_upgrade": false,
      "config_upgrade": true,
      "restart": {"vyx_service": ["S80samba.sh"], "pkg": ["DemoApp"]}
    }
  ]
}
JSON
    ;;
*)
    echo "make_site.sh: unknown part $WHAT" >&2
    exit 2
    ;;
esac
