#!/usr/bin/env bash
# Install into a fresh prefix and check the layout, the exported symbols and
# that a C program builds from pkg-config alone.
set -euo pipefail
build=$1
prefix=$(mktemp -d)
trap 'rm -rf "$prefix"' EXIT
cmake --install "$build" --prefix "$prefix" >/dev/null

fail() { echo "FAIL: $*" >&2; exit 1; }
libdir=$(dirname "$(find "$prefix" -name 'libryacl.so' | head -n1)")
[ -n "$libdir" ] || fail "no libryacl.so"
for f in bin/ryaclfck include/ryacl.h include/ry_zo.h share/ryacl/ryseclib.cat; do
  [ -e "$prefix/$f" ] || fail "missing $f"
done
[ -e "$libdir/libryacl.a" ] || fail "no static library"
[ -e "$libdir/pkgconfig/ryacl.pc" ] || fail "no ryacl.pc"
[ -e "$libdir/cmake/ryacl/ryaclConfig.cmake" ] || fail "no CMake package"
soname=$(objdump -p "$libdir/libryacl.so" | awk '/SONAME/ {print $2}')
[ "$soname" = "libryacl.so.1" ] || fail "soname is '$soname'"
# Only the headers meant for applications are installed.
extra=$(ls "$prefix/include" | grep -v -x -e ryacl.h -e ry_zo.h || true)
[ -z "$extra" ] || fail "internal headers installed: $extra"

# Exactly the public operations are exported.
exported=$(nm -D --defined-only "$libdir/libryacl.so" | awk '$2 ~ /^[TDBRV]$/ {print $3}' | sort)
unexpected=$(echo "$exported" | grep -v -E '^(sec_[a-z0-9_]+|sec__register_id_handler|sec__single_acle_perm|sec__group_acles_perm|acl__trace_unregister_component|zo_[a-z_]+_1)$' || true)
[ -z "$unexpected" ] || fail "unexpected exports: $(echo $unexpected)"
for sym in sec_create_acle sec_display_acle_id sec_release_acle sec_translate_perms sec_translate_bitmask \
           sec_read_acl_file sec_read_acl_from_data sec_create_empty_acl sec_convert_acl_to_host sec_release_acl \
           sec_add_acle_to_acl sec_add_acle_to_acl2 sec_del_acle_from_acl sec_list_acl sec_list_acl_by_type \
           sec_release_aclelist sec__register_id_handler sec__single_acle_perm sec__group_acles_perm \
           acl__trace_unregister_component zo_set_error_1 zo_set_no_error_1 zo_get_error_1 zo_pset_error_1 \
           zo_get_errmsg_1 zo_rel_error_1 zo_rel_errmsg_1; do
  echo "$exported" | grep -q -x "$sym" || fail "$sym not exported"
done

# pkg-config is all a C program needs.
cat > "$prefix/t.c" <<'C'
#include <ryacl.h>
#include <stdio.h>
int main(void) {
    sec_buffer_desc acl = {0, 0};
    if (sec_create_empty_acl(&acl) != 0 || acl.length != 5) return 1;
    puts(sec_release_acl(&acl) == 0 ? "ok" : "bad");
    return 0;
}
C
flags=$(PKG_CONFIG_PATH="$libdir/pkgconfig" pkg-config --cflags --libs ryacl)
cc -std=c99 -Wall -Wextra -Werror "$prefix/t.c" -o "$prefix/t" $flags
out=$(LD_LIBRARY_PATH="$libdir" "$prefix/t")
[ "$out" = ok ] || fail "client printed '$out'"
echo "install layout ok"
