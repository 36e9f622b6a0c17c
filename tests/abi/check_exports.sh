#!/bin/bash
# Checks the shared library's dynamic section and exported symbols:
#   check_exports.sh LIBRARY VERSION_SCRIPT SANITIZED(ON|OFF|"")
set -eu
lib=$1 map=$2 sanitized=${3:-}
fail=0

soname=$(readelf -d "$lib" | sed -n 's/.*Library soname: \[\(.*\)\]/\1/p')
[ "$soname" = libqorbu.so.5 ] || { echo "SONAME is '$soname', want libqorbu.so.5"; fail=1; }

needed=$(readelf -d "$lib" | sed -n 's/.*Shared library: \[\(.*\)\]/\1/p' | sort | tr '\n' ' ')
if [ -z "$sanitized" ] || [ "$sanitized" = OFF ]; then
    [ "$needed" = "libc.so.6 " ] || { echo "NEEDED is '$needed', want only libc.so.6"; fail=1; }
fi
# The host brings its own Net-SNMP, sanitized or not.
case $needed in *snmp*) echo "NEEDED names Net-SNMP: $needed"; fail=1 ;; esac

# Every global name in the version script, and nothing else, is defined and exported.
want=$(sed -e 's#/\*.*\*/##g' "$map" | tr ' ;' '\n\n' | grep -E '^[A-Za-z_][A-Za-z0-9_]*$' |
       grep -v -x -e global -e local | sort -u)
have=$(readelf --dyn-syms -W "$lib" | awk '$7 != "UND" && $5 != "LOCAL" && ($4 == "FUNC" || $4 == "OBJECT") {print $8}' |
       sed 's/@.*//' | sort -u)
if [ "$want" != "$have" ]; then
    echo "exported symbols differ from the version script (< wanted, > exported):"
    diff <(echo "$want") <(echo "$have")
    fail=1
fi
# No C++ runtime, no exception machinery.
cxx=$(readelf --dyn-syms -W "$lib" | grep -E 'GLIBCXX|CXXABI|_Znw|_Zdl|_ZTI|_Unwind|__gxx_personality|__cxa_(throw|begin_catch|guard)' || true)
[ -z "$cxx" ] || { echo "the library refers to the C++ runtime:"; echo "$cxx"; fail=1; }
[ $fail = 0 ] && echo "exports ok: $(printf '%s\n' "$have" | wc -l) symbols"
exit $fail
