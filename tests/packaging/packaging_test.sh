#!/bin/bash
# Builds the Debian packages from a fresh tree configured for /usr, checks
# their names, dependencies and contents, has lintian check them (any error or
# warning fails), unpacks them into a scratch root with dpkg -x and builds the
# ABI tests' C host against the unpacked files, once with pkg-config and once
# with find_package(qorbu). Last, the same tree installed under another prefix
# runs its programs without LD_LIBRARY_PATH.
# Usage: packaging_test.sh SOURCE_DIR SCRATCH_DIR
set -u
SRC=$1 W=$2
FAILURES=0
fail() { echo "FAIL: $*"; FAILURES=$((FAILURES + 1)); }
step() { echo "== $*"; }
die() { echo "FAIL: $*"; exit 1; }

rm -rf "$W" && mkdir -p "$W" || die "cannot make $W"
step "configure and build with prefix /usr"
cmake -S "$SRC" -B "$W/build" -G Ninja -DCMAKE_BUILD_TYPE=RelWithDebInfo -DCMAKE_INSTALL_PREFIX=/usr \
    -DQORBU_BUILD_TESTS=OFF -DQORBU_BUILD_BENCH=OFF >"$W/configure.log" 2>&1 || { cat "$W/configure.log"; die "configure"; }
cmake --build "$W/build" -j2 >"$W/build.log" 2>&1 || { tail -30 "$W/build.log"; die "build"; }

step "cpack -G DEB"
(cd "$W/build" && cpack -G DEB) >"$W/cpack.log" 2>&1 || { cat "$W/cpack.log"; die "cpack"; }
ARCH=$(dpkg --print-architecture)
VERSION=5.0.0
deb() { echo "$W/build/packages/$1_${VERSION}_${ARCH}.deb"; }
for package in libqorbu5 libqorbu-dev qorbu-tools; do
    [ -f "$(deb $package)" ] || die "no package $(basename "$(deb $package)"); made: $(ls "$W/build/packages")"
done

step "dependencies"
depends() { dpkg-deb -f "$(deb "$1")" Depends; }
[[ "$(depends libqorbu-dev)" == *"libqorbu5 (= $VERSION)"* ]] || fail "libqorbu-dev depends on '$(depends libqorbu-dev)'"
[[ "$(depends qorbu-tools)" == *"libqorbu5 (= $VERSION)"* ]] || fail "qorbu-tools depends on '$(depends qorbu-tools)'"
[[ "$(depends libqorbu5)" == *libc6* ]] || fail "libqorbu5 depends on '$(depends libqorbu5)'"

step "contents"
contents() { dpkg-deb -c "$(deb "$1")" | awk '{ print $6 }' | sed 's|^\./|/|'; }
has() { contents "$1" | grep -Eq -- "$2" || fail "$1 lacks $2"; }
lacks() { contents "$1" | grep -Eq -- "$2" && fail "$1 should not hold $2"; }
has libqorbu5 '^/usr/lib/.*/libqorbu\.so\.5$'
has libqorbu5 '^/usr/lib/.*/libqorbu\.so\.5\.0\.0$'
lacks libqorbu5 '\.h$|/libqorbu\.so$|pkgconfig'
for header in qorbu_api.h selector/sel.h selector/host.h shm/shm.h greenthreads/greenthread.h nbio/nb.h; do
    has libqorbu-dev "^/usr/include/qorbu/$header\$"
done
lacks libqorbu-dev '_private\.h$'
has libqorbu-dev '^/usr/lib/.*/libqorbu\.so$'
has libqorbu-dev '^/usr/lib/.*/pkgconfig/qorbu\.pc$'
has libqorbu-dev '^/usr/lib/.*/cmake/qorbu/qorbuConfig\.cmake$'
has libqorbu-dev '^/usr/lib/.*/cmake/qorbu/qorbuTargets\.cmake$'
lacks libqorbu-dev 'libqorbu\.so\.5'
for program in qorbu-shm qorbu-demo; do
    [ "$program" = qorbu-shm ] || [ -x "$W/build/examples/$program" ] || continue
    has qorbu-tools "^/usr/bin/$program\$"
    has qorbu-tools "^/usr/share/man/man1/$program\.1\.gz\$"
done

step "lintian"
# No overrides: every tag applies to these packages as it would to Debian's.
lintian --fail-on error,warning "$(deb libqorbu5)" "$(deb libqorbu-dev)" "$(deb qorbu-tools)" \
    >"$W/lintian.log" 2>&1 || { cat "$W/lintian.log"; fail "lintian"; }

step "dpkg -x into a scratch root"
ROOT=$W/root
for package in libqorbu5 libqorbu-dev qorbu-tools; do dpkg -x "$(deb $package)" "$ROOT" || die "dpkg -x $package"; done
PC=$(find "$ROOT" -name qorbu.pc) ; [ -n "$PC" ] || die "no qorbu.pc unpacked"
LIBDIR=$(dirname "$(dirname "$PC")")
export LD_LIBRARY_PATH=$LIBDIR

step "a host built with pkg-config"
export PKG_CONFIG_SYSROOT_DIR=$ROOT PKG_CONFIG_LIBDIR=$LIBDIR/pkgconfig
[ "$(pkg-config --modversion qorbu)" = "$VERSION" ] || fail "pkg-config version '$(pkg-config --modversion qorbu)'"
# shellcheck disable=SC2046
cc -std=c11 -pedantic-errors -D_POSIX_C_SOURCE=200809L -Wall -Wextra -Werror -o "$W/host-pkgconfig" \
    "$SRC/tests/abi/c_host.c" \
    $(pkg-config --cflags --libs qorbu) || fail "the pkg-config build"
if [ -x "$W/host-pkgconfig" ]; then
    ldd "$W/host-pkgconfig" | grep -q "$LIBDIR/libqorbu.so.5" || fail "the host does not load the unpacked library"
    "$W/host-pkgconfig" || fail "the pkg-config host exited $?"
fi
unset PKG_CONFIG_SYSROOT_DIR PKG_CONFIG_LIBDIR

step "a host built with find_package(qorbu)"
cmake -S "$SRC/tests/packaging/host" -B "$W/host-cmake" -G Ninja -DCMAKE_PREFIX_PATH="$ROOT/usr" \
    -DCMAKE_C_FLAGS="-Wall -Wextra -Werror" >"$W/host-cmake.log" 2>&1 &&
    cmake --build "$W/host-cmake" >>"$W/host-cmake.log" 2>&1 || { cat "$W/host-cmake.log"; fail "the find_package build"; }
[ -x "$W/host-cmake/c_host" ] && { "$W/host-cmake/c_host" || fail "the find_package host exited $?"; }

step "the unpacked tools run"
"$ROOT/usr/bin/qorbu-shm" --help >/dev/null || fail "qorbu-shm --help"
if [ -x "$ROOT/usr/bin/qorbu-demo" ]; then "$ROOT/usr/bin/qorbu-demo" --help >/dev/null || fail "qorbu-demo --help"; fi

step "a prefix install runs without LD_LIBRARY_PATH"
unset LD_LIBRARY_PATH
cmake --install "$W/build" --prefix "$W/prefix" >"$W/install.log" 2>&1 || { cat "$W/install.log"; die "cmake --install"; }
# qorbu-shm carries the allocator's internals itself; the demo loads the library.
if [ -x "$W/prefix/bin/qorbu-demo" ]; then
    ldd "$W/prefix/bin/qorbu-demo" | grep -q "libqorbu\.so\.5 => $W/prefix/" ||
        fail "qorbu-demo does not load the library of its prefix: $(ldd "$W/prefix/bin/qorbu-demo")"
    "$W/prefix/bin/qorbu-demo" --help >/dev/null || fail "qorbu-demo from the prefix"
fi
SEGMENT=qorbu-packaging-$$
"$W/prefix/bin/qorbu-shm" create "$SEGMENT" 4096 >/dev/null && "$W/prefix/bin/qorbu-shm" info "$SEGMENT" >/dev/null ||
    fail "qorbu-shm from the prefix"
"$W/prefix/bin/qorbu-shm" unlink "$SEGMENT" 2>/dev/null
[ -f "$W/prefix/share/man/man1/qorbu-shm.1.gz" ] || fail "the prefix install lacks qorbu-shm(1)"
[ ! -e "$W/prefix/share/doc" ] || fail "the prefix install holds the packages' Debian documents"

if [ "$FAILURES" != 0 ]; then
    echo "packaging: $FAILURES check(s) failed"
    exit 1
fi
rm -rf "$W"
echo "packaging: all checks held"
