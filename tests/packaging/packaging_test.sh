#!/bin/bash
# Builds the Debian packages from a fresh tree configured for /usr, checks
# their dependencies and contents, has lintian check them (any error or
# warning fails), unpacks them into a scratch root and builds the ABI tests'
# C host against the unpacked files, with pkg-config and with
# find_package(qorbu). Last, the same tree installed under another prefix
# runs its programs without LD_LIBRARY_PATH.
# Usage: packaging_test.sh SOURCE_DIR SCRATCH_DIR
set -u
SRC=$1 W=$2 VERSION=5.0.0 ARCH=$(dpkg --print-architecture)
FAILURES=0
fail() { echo "FAIL: $*"; FAILURES=$((FAILURES + 1)); }
die() { echo "FAIL: $*"; exit 1; }
quiet() { local log=$1; shift; "$@" >"$log" 2>&1 || { tail -30 "$log"; return 1; }; }

rm -rf "$W" && mkdir -p "$W" || die "cannot make $W"
quiet "$W/build.log" cmake -S "$SRC" -B "$W/build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo \
    -DCMAKE_INSTALL_PREFIX=/usr -DQORBU_BUILD_TESTS=OFF -DQORBU_BUILD_BENCH=OFF || die "configure"
quiet "$W/build.log" cmake --build "$W/build" -j2 || die "build"
(cd "$W/build" && quiet "$W/cpack.log" cpack -G DEB) || die "cpack"
deb() { echo "$W/build/packages/$1_${VERSION}_${ARCH}.deb"; }
for package in libqorbu5 libqorbu-dev qorbu-tools; do
    [ -f "$(deb $package)" ] || die "no package $package; made: $(ls "$W/build/packages")"
done

depends() { dpkg-deb -f "$(deb "$1")" Depends; }
for package in libqorbu-dev qorbu-tools; do
    [[ "$(depends $package)" == *"libqorbu5 (= $VERSION)"* ]] || fail "$package depends on '$(depends $package)'"
done
[[ "$(depends libqorbu5)" == *libc6* ]] || fail "libqorbu5 depends on '$(depends libqorbu5)'"

contents() { dpkg-deb -c "$(deb "$1")" | awk '{ print $6 }' | sed 's|^\./|/|'; }
has() { contents "$1" | grep -Eq -- "$2" || fail "$1 lacks $2"; }
lacks() { contents "$1" | grep -Eq -- "$2" && fail "$1 should not hold $2"; }
has libqorbu5 '^/usr/lib/.*/libqorbu\.so\.5$'
has libqorbu5 '^/usr/lib/.*/libqorbu\.so\.5\.0\.0$'
lacks libqorbu5 '\.h$|/libqorbu\.so$|pkgconfig'
for file in qorbu_api.h selector/sel.h selector/host.h shm/shm.h greenthreads/greenthread.h nbio/nb.h; do
    has libqorbu-dev "^/usr/include/qorbu/$file\$"
done
for file in libqorbu\\.so pkgconfig/qorbu\\.pc cmake/qorbu/qorbuConfig\\.cmake cmake/qorbu/qorbuTargets\\.cmake; do
    has libqorbu-dev "^/usr/lib/.*/$file\$"
done
lacks libqorbu-dev '_private\.h$|libqorbu\.so\.5'
for program in qorbu-shm qorbu-demo; do
    [ "$program" = qorbu-shm ] || [ -x "$W/build/examples/$program" ] || continue
    has qorbu-tools "^/usr/bin/$program\$"
    has qorbu-tools "^/usr/share/man/man1/$program\.1\.gz\$"
done
# No overrides: every tag applies to these packages as it would to Debian's.
quiet "$W/lintian.log" lintian --fail-on error,warning "$(deb libqorbu5)" "$(deb libqorbu-dev)" "$(deb qorbu-tools)" ||
    fail "lintian"

ROOT=$W/root
for package in libqorbu5 libqorbu-dev qorbu-tools; do dpkg -x "$(deb $package)" "$ROOT" || die "dpkg -x $package"; done
PC=$(find "$ROOT" -name qorbu.pc) && [ -n "$PC" ] || die "no qorbu.pc unpacked"
LIBDIR=$(dirname "$(dirname "$PC")")
export LD_LIBRARY_PATH=$LIBDIR
# shellcheck disable=SC2046
PKG_CONFIG_SYSROOT_DIR=$ROOT PKG_CONFIG_LIBDIR=$LIBDIR/pkgconfig sh -c 'pkg-config --modversion qorbu &&
    cc -std=c11 -pedantic-errors -Wall -Wextra -Werror -o "$1" "$2" $(pkg-config --cflags --libs qorbu)' \
    sh "$W/host-pkgconfig" "$SRC/tests/abi/c_host.c" | grep -qx "$VERSION" || fail "the pkg-config build"
ldd "$W/host-pkgconfig" | grep -q "$LIBDIR/libqorbu.so.5" || fail "the host does not load the unpacked library"
"$W/host-pkgconfig" || fail "the pkg-config host exited $?"
quiet "$W/host-cmake.log" cmake -S "$SRC/tests/packaging/host" -B "$W/host-cmake" -G Ninja \
    -DCMAKE_PREFIX_PATH="$ROOT/usr" -DCMAKE_C_FLAGS="-Wall -Wextra -Werror" &&
    quiet "$W/host-cmake.log" cmake --build "$W/host-cmake" || fail "the find_package build"
"$W/host-cmake/c_host" || fail "the find_package host exited $?"

unset LD_LIBRARY_PATH
quiet "$W/install.log" cmake --install "$W/build" --prefix "$W/prefix" || die "cmake --install"
# The demo loads the library (qorbu-shm carries the allocator's internals itself).
if [ -x "$W/prefix/bin/qorbu-demo" ]; then
    ldd "$W/prefix/bin/qorbu-demo" | grep -q "libqorbu\.so\.5 => $W/prefix/" ||
        fail "qorbu-demo does not load the library of its prefix: $(ldd "$W/prefix/bin/qorbu-demo")"
    "$W/prefix/bin/qorbu-demo" --help >/dev/null || fail "qorbu-demo from the prefix"
fi
[ -f "$W/prefix/share/man/man1/qorbu-shm.1.gz" ] || fail "the prefix install lacks qorbu-shm(1)"
[ ! -e "$W/prefix/share/doc" ] || fail "the prefix install holds the packages' Debian documents"

[ "$FAILURES" = 0 ] || die "packaging: $FAILURES check(s) failed"
rm -rf "$W"
echo "packaging: all checks held"
