#!/usr/bin/env bash
# Installs the Debian packages that the build, the tests and the benchmarks need.
# Idempotent: when everything is present it only asks dpkg and returns.
set -euo pipefail

packages=(
  build-essential cmake ninja-build pkg-config clang libclang-rt-14-dev
  libjsoncpp-dev libboost-dev libsqlite3-dev libacl1-dev
  libgtest-dev libgmock-dev googletest libbenchmark-dev
  libmagic-dev libpoppler-cpp-dev libtag1-dev libexiv2-dev libarchive-dev
  libxml2-dev libuchardet-dev libmediainfo-dev libssl-dev libpam0g-dev
  libgmime-3.0-dev libtesseract-dev tesseract-ocr-eng unrtf catdoc ghostscript djvulibre-bin
  groff-base
  e2fsprogs mount util-linux acl passwd
  python3
  chromium chromium-driver python3-selenium openssl curl
  gzip bzip2 xz-utils zstd lz4 zip p7zip-full cpio binutils
  samba smbclient
  libsystemd-dev libseccomp-dev
  postgresql-15 postgresql-contrib libpq-dev
  debhelper dpkg-dev fakeroot lintian pandoc systemd bash-completion
)

missing=()
for p in "${packages[@]}"; do
  dpkg-query -W -f='${Status}' "$p" 2>/dev/null | grep -q "install ok installed" || missing+=("$p")
done
[ ${#missing[@]} -eq 0 ] && exit 0

echo "setup: installing ${missing[*]}" >&2
sudo=""
[ "$(id -u)" -eq 0 ] || sudo="sudo"
export DEBIAN_FRONTEND=noninteractive
# samba is here for the search gateway's test, which runs an smbd of its own: the package must
# not start the machine's file-server services, so starting services is refused while it is
# installed (unless the machine already has a policy of its own).
policy=/usr/sbin/policy-rc.d
if [ ! -e "$policy" ]; then
  printf '#!/bin/sh\nexit 101\n' | $sudo tee "$policy" >/dev/null
  $sudo chmod 755 "$policy"
  trap '$sudo rm -f "$policy"' EXIT
fi
$sudo apt-get update -qq
$sudo apt-get install -y -qq --no-install-recommends "${missing[@]}"
