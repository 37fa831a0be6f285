#!/usr/bin/env bash
# Install into a fresh prefix and check the layout and that exactly the public
# operations are exported.  (Clients built through find_package and through
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
expected="acl__trace_unregister_component sec__group_acles_perm sec__register_id_handler sec__single_acle_perm
  sec_add_acle_to_acl sec_add_acle_to_acl2 sec_convert_acl_to_host sec_create_acle sec_create_empty_acl
  sec_del_acle_from_acl sec_display_acle_id sec_list_acl sec_list_acl_by_type sec_read_acl_file
  sec_read_acl_from_data sec_release_acl sec_release_acle sec_release_aclelist sec_translate_bitmask
  sec_translate_perms zo_get_errmsg_1 zo_get_error_1 zo_pset_error_1 zo_rel_errmsg_1 zo_rel_error_1
  zo_set_error_1 zo_set_error_argv_1 zo_set_no_error_1"
exported=$(nm -D --defined-only "$libdir/libryacl.so" | awk '$2 ~ /^[TDBRV]$/ {print $3}' | sort)
[ "$(echo $exported)" = "$(printf '%s\n' $expected | sort | xargs)" ] || fail "exported: $(echo $exported)"
echo "install layout ok"
