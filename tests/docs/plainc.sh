#!/usr/bin/env bash
# Are these programs and libraries plain C at run time? plainc.sh FILE...
# An engine loads the libraries into programs of its own, which may have another C++ library or none.
set -u
failures=0
for file; do
  needed=$(readelf -d "$file" | grep -oP 'NEEDED.*\[\K[^]]+') # nothing: no such file
  [[ $needed == *libc.so* && ! $needed =~ libstdc|libc\+\+|libgcc ]] && continue
  echo "$file needs ${needed//$'\n'/ }"
  failures=$((failures + 1))
done
exit $((failures > 0))
