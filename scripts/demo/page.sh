#!/bin/bash
# Starts the sample update page (www/) on the appliance: fcgiwrap running kytoupdate-cgi
# (as root, as the library needs) on a Unix socket only nginx's workers may use, and nginx
# on 127.0.0.1:PORT.  Run inside the sandbox by appliance.sh --page; both end with it.
#   page.sh BUILD_DIR PORT
set -euo pipefail
BUILD=$1
PORT=$2
HERE=$(cd "$(dirname "$0")" && pwd)
WWW=$(cd "$HERE/../../www" && pwd)
STATE=/run/kyto-page
mkdir -p $STATE
chgrp www-data $STATE
chmod 0750 $STATE
rm -f $STATE/fcgiwrap.sock
# fcgiwrap makes the socket with its umask; nginx's workers (www-data) reach it by group.
(umask 0007 && setsid fcgiwrap -c 4 -s unix:$STATE/fcgiwrap.sock </dev/null \
    >>$STATE/fcgiwrap.log 2>&1 &)
for _ in $(seq 50); do [ -S $STATE/fcgiwrap.sock ] && break; sleep 0.1; done
chgrp www-data $STATE/fcgiwrap.sock
# nginx's workers (www-data) may not reach into the checkout (a clone in a private folder):
# the page is served from a copy.
rm -rf $STATE/www
cp -r "$WWW" $STATE/www
chgrp -R www-data $STATE/www
sed -e "s|@PORT@|$PORT|; s|@STATE@|$STATE|g; s|@WWW@|$STATE/www|" \
    -e "s|@CGI@|$BUILD/tools/kytoupdate-cgi|; s|@KYTOUPDATE@|$BUILD/tools/kytoupdate|" \
    "$HERE/page-nginx.conf.in" >$STATE/nginx.conf
nginx -e $STATE/error.log -c $STATE/nginx.conf
