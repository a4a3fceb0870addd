#!/usr/bin/env bash
# Checks what libtelvane.so gives and needs:
# - its dynamic symbols are exactly the committed list (an accidental export or a
#   removal fails; after a deliberate change, run with --update to rewrite the list);
# - it has its SONAME;
# - it needs no library of the daemon's side at run time.
# Usage: check_exports.sh LIBRARY SYMBOL_LIST [--update]
set -euo pipefail
library=$1
list=$2

actual=$(nm -D --defined-only "$library" | awk '{print $3}' | sed 's/@.*//' | c++filt | LC_ALL=C sort -u)
if [ "${3:-}" = "--update" ]; then
  printf '%s\n' "$actual" >"$list"
  echo "wrote $(wc -l <"$list") symbols to $list"
  exit 0
fi

status=0
if ! diff -u "$list" <(printf '%s\n' "$actual") >/tmp/telvane-exports.$$.diff; then
  echo "The exported symbols of $library differ from $list:"
  cat /tmp/telvane-exports.$$.diff
  echo "If the change is deliberate, run: $0 $library $list --update"
  status=1
fi
rm -f /tmp/telvane-exports.$$.diff

soname=$(readelf -d "$library" | sed -n 's/.*Library soname: \[\(.*\)\]/\1/p')
if [ "$soname" != "libtelvane.so.0" ]; then
  echo "SONAME is '$soname', expected libtelvane.so.0"
  status=1
fi

# The client library needs the C and C++ runtimes and the IPC encoding, nothing else
# (the sanitizer runtimes in sanitizer builds).
needed=$(readelf -d "$library" | sed -n 's/.*Shared library: \[\(.*\)\]/\1/p')
for lib in $needed; do
  case "$lib" in
    libc.so.* | libm.so.* | libstdc++.so.* | libgcc_s.so.* | ld-linux*.so.* | libmsgpackc.so.*) ;;
    libasan.so.* | libubsan.so.* | libtsan.so.*) ;;
    *)
      echo "libtelvane.so needs $lib at run time; the client library must not"
      status=1
      ;;
  esac
done

[ $status -eq 0 ] && echo "$(printf '%s\n' "$actual" | wc -l) exported symbols as listed; needs: $(echo $needed)"
exit $status
