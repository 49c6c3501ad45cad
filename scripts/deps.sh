#!/usr/bin/env bash
# Installs what building, testing and trying zrd needs, on Debian 12 or later. Does nothing, and needs
# no rights, where everything is installed already.
set -euo pipefail

packages=(
    cmake ninja-build g++ clang clang-format clang-tidy ccache pkg-config git ca-certificates
    libplist-dev libcbor-dev libssl-dev libsqlite3-dev libasio-dev libsystemd-dev uuid-dev
    libfmt-dev systemtap-sdt-dev libseccomp-dev libcli11-dev nlohmann-json3-dev libgtest-dev libgmock-dev
    libbenchmark-dev libclang-rt-dev llvm shared-mime-info bubblewrap passt strace systemd util-linux
    dpkg-dev make
)

missing=()
for package in "${packages[@]}"; do
    status=$(dpkg-query -W -f='${db:Status-Status}' "$package" 2>/dev/null || true)
    [ "$status" = installed ] || missing+=("$package")
done
[ "${#missing[@]}" -gt 0 ] || exit 0

as_root=()
[ "$(id -u)" = 0 ] || as_root=(sudo)
export DEBIAN_FRONTEND=noninteractive
"${as_root[@]}" apt-get update -q
"${as_root[@]}" apt-get install -q -y --no-install-recommends "${missing[@]}"
