#!/usr/bin/env bash
# Installs the Debian packages that are missing. usage: bootstrap.sh build|check
set -euo pipefail

build=(cmake ninja-build g++ make pkg-config ccache python3 libexpat1-dev libsqlite3-dev libssl-dev libsystemd-dev
       libseccomp-dev systemtap-sdt-dev libcli11-dev nlohmann-json3-dev libgtest-dev libgmock-dev libbenchmark-dev
       strace binutils)
check=(clang-19 clang-tidy-19 clang-format-19 libclang-rt-19-dev valgrind)

packages=("${build[@]}")
[ "${1:-build}" = check ] && packages+=("${check[@]}")

missing=()
for package in "${packages[@]}"; do
    status=$(dpkg-query -W -f '${Status}' "$package" 2>/dev/null || true)
    [ "$status" = "install ok installed" ] || missing+=("$package")
done
[ ${#missing[@]} -eq 0 ] && exit 0

as_root=()
if [ "$(id -u)" -ne 0 ]; then
    command -v sudo >/dev/null || { echo "bootstrap: run as root, or install sudo, to get: ${missing[*]}" >&2; exit 1; }
    as_root=(sudo)
fi
echo "installing: ${missing[*]}"
"${as_root[@]}" env DEBIAN_FRONTEND=noninteractive apt-get update -qq
"${as_root[@]}" env DEBIAN_FRONTEND=noninteractive apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
