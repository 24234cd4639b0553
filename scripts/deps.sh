# Debian packages needed to build and test the project; sourced by build.sh and test.sh.
# Installs only what is missing, so a second run does not touch apt at all.
# libcli11-dev: the header-only option parser of the command-line driver (tools/).
# libssl-dev: the MD5 kytosite computes while it copies a release image.
# libsodium-dev: the signatures of published files (tools/trust); minisign checks that ours
# and its files agree (tests/tools/kytotrust_test.cpp).
KYTO_BUILD_PACKAGES=(cmake g++ make pkg-config libjsoncpp-dev libcurl4-openssl-dev libcli11-dev
    libsodium-dev libssl-dev)
KYTO_TEST_PACKAGES=(googletest libgtest-dev libgmock-dev libbenchmark-dev wget openssl tar
    dpkg dpkg-dev python3 util-linux clang-format ca-certificates minisign)
# Hardening checks (scripts/hardening.sh): libFuzzer targets built with clang, its runtime
# libraries (libFuzzer and the sanitizers), and Valgrind's memcheck for the leak run.
KYTO_HARDENING_PACKAGES=(clang libclang-rt-dev valgrind)
# The sample update server of scripts/demo.sh, fcgiwrap for its update page's back end and
# socat to bring that page from the sandbox's loopback to the host's.
KYTO_DEMO_PACKAGES=(nginx fcgiwrap socat)
# The update page's browser test (tests/page/page_test.sh): headless Chromium and ChromeDriver.
KYTO_PAGE_TEST_PACKAGES=(chromium chromium-driver)

kyto_install_packages() {
    local missing=() pkg
    for pkg in "$@"; do
        if ! dpkg-query -W -f='${Status}' "$pkg" 2>/dev/null | grep -q 'install ok installed'; then
            missing+=("$pkg")
        fi
    done
    if [ ${#missing[@]} -eq 0 ]; then
        echo "== packages: all ${#} present"
        return 0
    fi
    echo "== packages: installing ${missing[*]}"
    export DEBIAN_FRONTEND=noninteractive
    apt-get update -qq
    apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
}

# Installs packages without starting their services on the host: Debian's nginx and
# fcgiwrap would start theirs, and the demo and the tests need only the programs.  A
# policy-rc.d that refuses every start (exit 101) lives for the length of the install; one
# already there is left as it is.  Sets and then clears the EXIT trap.
kyto_install_packages_without_services() {
    local policy=/usr/sbin/policy-rc.d rc=0
    if [ -e $policy ]; then
        kyto_install_packages "$@"
        return
    fi
    printf '#!/bin/sh\nexit 101\n' >$policy
    chmod 0755 $policy
    trap "rm -f $policy" EXIT
    kyto_install_packages "$@" || rc=$?
    rm -f $policy
    trap - EXIT
    return $rc
}

kyto_require_root() {
    if [ "$(id -u)" -ne 0 ]; then
        echo "$0: must run as root (package installation and the test sandbox need it)" >&2
        exit 1
    fi
}
