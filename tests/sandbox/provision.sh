#!/bin/sh
# Provisions a fresh sandbox root (run by kyto-sandbox after chroot, cwd "/") with the
# appliance files the library expects.  Silent on success: the test program's standard
# output must stay clean (test discovery parses it).  Any failure ends the run.
set -eu

fail() {
    echo "provision.sh: $*" >&2
    exit 1
}

for tool in wget openssl dpkg tar; do
    command -v "$tool" >/dev/null 2>&1 ||
        fail "'$tool' is missing on this machine (apt-get install wget openssl dpkg tar)"
done

mkdir -p /etc.defaults /usr/kyto/bin /usr/kyto/etc/rc.d /var/log /run
[ -e /var/run ] || ln -s /run /var/run
mkdir -p /var/run
chmod 1777 /tmp

cat >/etc.defaults/VERSION <<'EOF'
majorversion="5"
minorversion="2"
buildphase="GM"
buildnumber="5644"
builddate="2026/10/01"
EOF

cat >/etc.defaults/kytoinfo.conf <<'EOF'
unique="demo_model"
timezone="Europe/Berlin"
supportraid="no"
support_buildin_storage="no"
maxdisks="4"
EOF

ln -sf "$(readlink -f "$(command -v wget)")" /usr/kyto/bin/wget
ln -sf "$(readlink -f "$(command -v openssl)")" /usr/kyto/bin/openssl

# Fake appliance program: appends "name<TAB>arg1<TAB>arg2..." to /var/log/kyto-calls.log
# and exits 0, or with the number in /var/run/fake-exit/<name> when that file exists.
write_recorder() {
    cat >"$1" <<'EOF'
#!/bin/sh
name=${0##*/}
line=$name
for arg in "$@"; do
    line="$line	$arg"
done
printf '%s\n' "$line" >>/var/log/kyto-calls.log
if [ -f "/var/run/fake-exit/$name" ]; then
    exit "$(cat "/var/run/fake-exit/$name")"
fi
exit 0
EOF
    chmod 0755 "$1"
}

write_recorder /usr/kyto/bin/kytovyxnotify
write_recorder /usr/kyto/bin/kytopkg
for script in S01iptables.sh S20samba.sh S99sshd.sh; do
    write_recorder "/usr/kyto/etc/rc.d/$script"
done
