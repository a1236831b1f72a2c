#!/usr/bin/env bash
# Installs the Debian packages the project needs to build, test and run,
# when any is missing. Needs root for the install (apt-get update first).
# --tests adds what only the tests need.
set -euo pipefail

# The page is built with Node.js and npm, which the machine brings (20.19 or
# newer, for its bundler); Debian 12's own nodejs is too old to stand in.
if ! command -v npm >/dev/null; then
  echo "Node.js 20.19+ with npm is needed to build the package center page" >&2
  exit 1
fi

PACKAGES=(
  g++ cmake ninja-build pkg-config ccache clang-format clang libclang-rt-dev
  libjsoncpp-dev libcrypt-dev libgtest-dev googletest
  libarchive-dev libsqlite3-dev libcurl4-openssl-dev libgpgme-dev libpoco-dev libssl-dev libpng-dev
  lighttpd lighttpd-mod-deflate php-cli gnupg curl procps
)
# The page's browser tests drive Debian's chromium; the demo does not need it.
# The tests and the upgrade benchmark make XFS and Btrfs volumes in files.
[ "${1:-}" = --tests ] && PACKAGES+=(chromium xfsprogs btrfs-progs)

missing=()
for p in "${PACKAGES[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q 'install ok installed' || missing+=("$p")
done
[ ${#missing[@]} -eq 0 ] && exit 0

if [ "$(id -u)" -ne 0 ]; then
  echo "missing Debian packages: ${missing[*]}" >&2
  echo "run as root, or: sudo apt-get install ${missing[*]}" >&2
  exit 1
fi
echo "installing: ${missing[*]}"
export DEBIAN_FRONTEND=noninteractive
apt-get update -qq
apt-get install -y -qq --no-install-recommends "${missing[@]}" >/dev/null
