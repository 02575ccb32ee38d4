#!/usr/bin/env bash
# Builds the Debian packages, looks them over with lintian, unpacks them into a scratch directory and
# runs the programs from there.
#
#   scripts/try-install.sh [ROOT]
#
# With ROOT, a Debian tree to be thrown away (debootstrap --variant=minbase bookworm ROOT), the
# packages are also installed there, tried by debian/tests and removed; needs root's rights.
set -euo pipefail
cd "$(dirname "$0")/.."
. scripts/prerequisites.sh
need g++ cmake ninja-build debhelper dpkg-dev lintian libgtest-dev libgmock-dev mandoc jq \
  nlohmann-json3-dev

scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT
mkdir "$scratch/source" "$scratch/db"
git ls-files -z --cached --others --exclude-standard | xargs -0 cp --parents -t "$scratch/source"
echo "== building the packages"
(cd "$scratch/source" && DEB_BUILD_OPTIONS="nocheck parallel=$(nproc)" dpkg-buildpackage -us -uc -b) \
  >"$scratch/log" 2>&1 || {
  cat "$scratch/log"
  exit 1
}
mkdir -p build/packages
rm -f build/packages/*
cp "$scratch"/*.deb "$scratch"/*.changes "$scratch"/*.buildinfo build/packages/
for package in build/packages/*.deb; do
  echo "== $package"
  dpkg-deb --contents "$package" | awk '!/\/$/ { print "  " $3, $6, $7, $8 }'
  case $package in *-dbgsym_*) ;; *) dpkg-deb -x "$package" "$scratch/root" ;; esac
done
echo "== lintian"
lintian --fail-on error build/packages/*.changes

echo "== a plan from the unpacked packages"
LD_LIBRARY_PATH=$(dirname "$(find "$scratch/root" -name libzq3.so.1)")
export LD_LIBRARY_PATH
sed "s|/usr/share|$scratch/root&|" debian/tests/plan >"$scratch/plan"
PATH=$scratch/root/usr/bin:$PATH AUTOPKGTEST_TMP=$scratch/db sh "$scratch/plan"

[ $# -eq 0 ] && exit 0
echo "== installed in $1, tried, removed"
mkdir -p "$1/packages"
cp build/packages/*.deb debian/tests/plan debian/tests/link "$1/packages"
# A mount namespace of its own: nothing stays mounted, whatever happens.
# shellcheck disable=SC2016
unshare --mount sh -euc 'mount -t proc proc "$0/proc" && exec chroot "$0" sh -euc "$1"' "$1" '
  export DEBIAN_FRONTEND=noninteractive
  apt-get -qq update
  apt-get -qq install -y --no-install-recommends cmake g++ make pkgconf >/dev/null
  rm -f /packages/*-dbgsym_*
  find / -xdev -not -path "/var/*" -not -path "/proc/*" -not -path "/tmp/*" | sort >/packages/before
  dpkg -i /packages/*.deb
  sh /packages/plan
  sh /packages/link
  dpkg -P zq3ckrst libsqluhist-dev libzq3-1 libzq3osse1
  find / -xdev -not -path "/var/*" -not -path "/proc/*" -not -path "/tmp/*" | sort |
    diff /packages/before - || true
  echo "(files left behind are listed above)"'
