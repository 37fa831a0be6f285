// Recording errors the library's way: return code, catalog "ryseclib.cat",
// set 1, a message number of the default table and its arguments, passed in
// the order of their placeholder positions.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <type_traits>

#include "ry_zo.h"

extern "C" {
// The default message table: 623 texts indexed by message number.
extern const char *const zo_mesgtbl_ryseclib_msg[];
extern const char zo_badid_ryseclib_msg[];
}

#define RYSECLIB_CAT "ryseclib.cat"
#define RYSECLIB_SET 1
#define RYSECLIB_MSG_COUNT 623

// Source location carried by validity messages (97, 106 to 114, 118, 91): the
// unit's name and the line of the check.
#define ACL_LOC_ACL "security/ACL/lib/ryacl_acl", __LINE__
#define ACL_LOC_UTILS "security/ACL/lib/ryacl_utils", __LINE__

namespace acl {

// Default text of a message; the bad-id text for a number outside the table.
const char *msg_text(int32_t msgnum);

// One argument as the error facility stores it.
struct err_arg {
    zo_error_arg_t a;
    err_arg(const char *s) { a.zo_arg_type = ZO_ERROR_ARG_CHAR_STR; a.zo_arg_value.zo_arg_char_str = const_cast<char *>(s ? s : ""); }
    template <class T, class = std::enable_if_t<std::is_integral_v<T>>>
    err_arg(T v) { a.zo_arg_type = ZO_ERROR_ARG_INT; a.zo_arg_value.zo_arg_int = static_cast<int>(v); }
    err_arg(const void *p) { a.zo_arg_type = ZO_ERROR_ARG_INT; a.zo_arg_value.zo_arg_int = static_cast<int>(reinterpret_cast<uintptr_t>(p)); }
};

int32_t set_error_list(int32_t rc, int32_t msgnum, std::initializer_list<err_arg> args);

// Record an error and return rc, so a failure reads `return set_error(...)`.
// Integers become int arguments ("%d", "%x", "%c"); texts are copied.  A
// pointer value (message 88's parameter value) is passed as its low 32 bits.
template <class... A>
int32_t set_error(int32_t rc, int32_t msgnum, A... args) {
    return set_error_list(rc, msgnum, {err_arg(args)...});
}

// Clear the calling thread's error slot.
inline void clear_error() { zo_set_no_error_1(); }

// The report sequence: fetch the current error, format it, write it to
// `stream` (a FILE *) with "%s\n" when extra_newline, else as it is, release
// both.  Prints nothing when the slot is empty.
void report_current_error(void *stream, bool extra_newline);

}  // namespace acl
