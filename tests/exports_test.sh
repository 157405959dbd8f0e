#!/usr/bin/env bash
# The exported C surface of libdpx is exactly what include/dpx/dpx.h declares
# with DPX_API: nothing missing, nothing extra (C++ names of the text classes
# aside).
set -euo pipefail
header=$1 library=$2
declared=$(grep -v "^#define" "$header" | tr '\n' ' ' | grep -oE 'DPX_API[^;{]*' |
  sed -E 's/\(.*//; s/\[.*//; s/.*[^A-Za-z0-9_]([A-Za-z_][A-Za-z0-9_]*)\s*$/\1/' | sort -u)
exported=$(nm -D --defined-only "$library" | awk '{print $3}' | sed 's/@.*//' | grep -v -e '^_Z' -e '^__' -e '^DPX_1$' | sort -u)
missing=$(comm -23 <(echo "$declared") <(echo "$exported"))
extra=$(comm -13 <(echo "$declared") <(echo "$exported"))
[ -z "$missing" ] || { echo "declared but not exported:"; echo "$missing"; }
[ -z "$extra" ] || { echo "exported but not declared:"; echo "$extra"; }
[ -z "$missing$extra" ] && echo "$(echo "$declared" | wc -l) exported names match the header"
