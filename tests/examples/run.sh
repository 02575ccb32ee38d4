#!/usr/bin/env bash
# Two backups appended, then read: run.sh APPEND SCAN ZQ3HIST
set -u
append=$1 scan=$2 zq3hist=$3
scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT
mkdir "$scratch/SAMPLE"
export ZQ3DBPATH=$scratch ZQ3DIAGLOG=/dev/null ZQ3SYNC=off

tell() { "$@" 2>&1; echo "[$?]"; }
found=$(
  cd "$scratch" || exit
  tell "$append" SAMPLE/ 20250105010000 CATALOG USERS
  tell "$append" SAMPLE/ 20250104010000 CATALOG # older, and written last
  tell "$append" SAMPLE 20250106010000 CATALOG  # no separator: nothing is written beside
  echo *
  tell "$scan" sample
  tell "$scan" nosuch
  tell "$zq3hist" verify SAMPLE
  "$zq3hist" status --json SAMPLE |
    grep -o '"\(headerEntryCount\|newestOffset\|max[a-zA-Z]*\)":[0-9]*' | sort -u
)
diff - <(echo "$found") <<'END'
[0]
[0]
append: nothing was appended: code -2097151978
[1]
SAMPLE
20250105010000, 2 tablespaces
20250104010000, 1 tablespaces
[0]
zq3HistoryOpenScan: SQLCODE -2036
[1]
zq3rhist.asc: sound, 2 entries
zq3rhist.bak: sound, 2 entries
[0]
"headerEntryCount":2
"maxCommandLength":0
"maxTablespaceCount":2
"newestOffset":1024
END
