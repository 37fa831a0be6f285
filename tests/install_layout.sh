#!/usr/bin/env bash
# Install into a fresh prefix and check the layout.  (What the library
# exports: install_abi.cmake; clients built through find_package and through
# pkg-config: install_client.cmake.)
set -euo pipefail
prefix=$(mktemp -d)
trap 'rm -rf "$prefix"' EXIT
cmake --install "$1" --prefix "$prefix" >/dev/null
fail() { echo "FAIL: $*" >&2; exit 1; }
libdir=$(dirname "$(find "$prefix" -name 'libryacl.so' | head -n1)")
for f in bin/ryaclfck include/ryacl.h include/ry_zo.h share/ryacl/ryseclib.cat "${libdir#$prefix/}/libryacl.a"; do
  [ -e "$prefix/$f" ] || fail "missing $f"
done
soname=$(objdump -p "$libdir/libryacl.so" | awk '/SONAME/ {print $2}')
[ "$soname" = "libryacl.so.1" ] || fail "soname is '$soname'"
extra=$(ls "$prefix/include" | grep -v -x -e ryacl.h -e ry_zo.h || true)
[ -z "$extra" ] || fail "internal headers installed: $extra"
echo "install layout ok"
