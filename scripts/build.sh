#!/usr/bin/env bash
# Builds and installs the library and the platform layer (default prefix /usr/local).
# Run as root on a Debian machine:  bash scripts/build.sh
set -euo pipefail
cd "$(dirname "$0")/.."
source scripts/deps.sh
kyto_require_root

PREFIX=${PREFIX:-/usr/local}
kyto_install_packages "${KYTO_BUILD_PACKAGES[@]}"

echo "== configure (build/)"
cmake -S . -B build -DCMAKE_BUILD_TYPE=RelWithDebInfo -DKYTO_BUILD_TESTS=OFF -DKYTO_WERROR=ON \
    -DCMAKE_INSTALL_PREFIX="$PREFIX" >/dev/null
echo "== build"
cmake --build build -j"$(nproc)"
echo "== install into $PREFIX"
cmake --install build >/dev/null
ldconfig 2>/dev/null || true

echo "build.sh: done. The command-line driver is not built yet; the library is installed in" \
    "$PREFIX (libkytoinstallcpp, libkytoplatform, headers, pkg-config file kytoinstallcpp.pc," \
    "CMake package kytoinstallcpp)."
if [ "$PREFIX" != /usr/local ] && [ "$PREFIX" != /usr ]; then
    echo "build.sh: the libraries carry no run path; programs find them in $PREFIX with" \
        "LD_LIBRARY_PATH or an ld.so.conf entry."
fi
