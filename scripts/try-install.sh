#!/usr/bin/env bash
# Builds the Debian package, unpacks it into a scratch directory, plans a restore with the programs
# in there, and builds a program against it by pkg-config and by find_package.
#
#   scripts/try-install.sh [ROOT]
#
# With ROOT, a Debian tree to be thrown away (debootstrap --variant=minbase bookworm ROOT), the
# package is also installed there, tried from /usr/bin and removed; needs root's rights.
set -euo pipefail
cd "$(dirname "$0")/.."
. scripts/prerequisites.sh
need g++ cmake ninja-build dpkg-dev pkgconf

cmake --preset release -B build/package -DCMAKE_INSTALL_PREFIX=/usr -DZQ3_TESTS=OFF \
  -DZQ3_BENCH=OFF >/dev/null
cmake --build build/package >/dev/null
rm -f build/package/*.deb
(cd build/package && cpack -G DEB >/dev/null)
package=$(echo build/package/*.deb)
echo "== $package"
dpkg-deb -I "$package" control

scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT
dpkg-deb -x "$package" "$scratch/root"
libraries=$(dirname "$(find "$scratch/root" -name libsqluhist.a)")
export PKG_CONFIG_PATH=$libraries/pkgconfig LD_LIBRARY_PATH=$libraries ZQ3DIAGLOG=$scratch/log

cat >"$scratch/plan.sh" <<'END'
# plan.sh BIN EXAMPLES DIR: loads a sample and plans a restore to its newest image.
set -eu
mkdir -p "$3/SAMPLE"
export ZQ3DBPATH=$3
"$1/zq3hist" load "$3/SAMPLE" "$2/week.zq3" >/dev/null
newest=$("$1/zq3hist" dump "$3/SAMPLE" | sed -n "s/^Timestamp: //p" | sort | tail -n 1)
"$1/zq3ckrst" -d sample -t "$newest" -r tablespace
END
echo "== a plan from the unpacked package"
sh "$scratch/plan.sh" "$scratch/root/usr/bin" "$scratch/root/usr/share/doc/zq3ckrst/examples" \
  "$scratch/db"

echo "== a program built against it"
cat >"$scratch/consumer.cpp" <<'END'
#include <cstdio>

#include "history/sqluhist.h"
#include "sqo/sqlzkrcb.h"

int main(int, char** argv)
{
    bool empty = false;
    int rc = sqluhIsHistoryFileEmpty(argv[1], &empty);
    printf("rc %d, %s, node %d\n", rc, empty ? "empty" : "not empty", sqlz_krcbp->nodeNumber);
    return rc == 0 && !empty ? 0 : 1;
}
END
# shellcheck disable=SC2046
g++ -std=c++17 -o "$scratch/by-pkgconf" "$scratch/consumer.cpp" \
  $(pkg-config --cflags --libs libsqluhist)
"$scratch/by-pkgconf" "$scratch/db/SAMPLE/"
cat >"$scratch/CMakeLists.txt" <<'END'
cmake_minimum_required(VERSION 3.25)
project(consumer LANGUAGES CXX)
find_package(sqluhist 1.0 REQUIRED)
add_executable(consumer consumer.cpp)
target_link_libraries(consumer PRIVATE zq3::sqluhist)
END
cmake -S "$scratch" -B "$scratch/build" -DCMAKE_PREFIX_PATH="$scratch/root/usr" >/dev/null
cmake --build "$scratch/build" >/dev/null
"$scratch/build/consumer" "$scratch/db/SAMPLE/"

[ $# -eq 0 ] && exit 0
echo "== installed in $1, tried, removed"
cp "$package" "$1/package.deb"
cp "$scratch/plan.sh" "$1/plan.sh"
cp -r examples "$1/examples"
# A mount namespace of its own: nothing stays mounted, whatever happens.
# shellcheck disable=SC2016
unshare --mount sh -euc 'mount -t proc proc "$0/proc" && exec chroot "$0" sh -euc "$1"' "$1" '
  find / -xdev -not -path "/var/*" -not -path "/proc/*" | sort >/before
  dpkg -i /package.deb
  sh /plan.sh /usr/bin /examples /db
  man=$(dpkg -L zq3ckrst | grep -c /man/ || true); echo "files of the package under /man/: $man"
  rm -r /db
  dpkg -P zq3ckrst
  find / -xdev -not -path "/var/*" -not -path "/proc/*" | sort | diff /before - |
    grep "^[<>]" | grep -v /before || true
  echo "(files left behind are listed above)"'
