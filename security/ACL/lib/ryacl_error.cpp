// Recording and reporting errors through the default message table.
#include "ryacl_error.h"

#include <cstdio>
#include <vector>

namespace acl {

const char *msg_text(int32_t msgnum) {
    if (msgnum < 0 || msgnum >= RYSECLIB_MSG_COUNT) return zo_badid_ryseclib_msg;
    return zo_mesgtbl_ryseclib_msg[msgnum];
}

int32_t set_error_list(int32_t rc, int32_t msgnum, std::initializer_list<err_arg> args) {
    zo_error_arg_t argv[16];
    unsigned n = 0;
    for (const err_arg &a : args) {
        if (n == 16) break;
        argv[n++] = a.a;
    }
    zo_set_error_argv_1(rc, nullptr, RYSECLIB_CAT, RYSECLIB_SET, msgnum, msg_text(msgnum), n, argv);
    return rc;
}

void report_current_error(void *stream, bool extra_newline) {
    FILE *f = static_cast<FILE *>(stream);
    zo_error_t *rec = nullptr;
    char *text = nullptr;
    zo_get_error_1(&rec);
    if (!rec) return;
    zo_get_errmsg_1(rec, &text);
    if (text) {
        if (extra_newline) std::fprintf(f, "%s\n", text);
        else std::fputs(text, f);
    }
    zo_rel_error_1(rec);
    zo_rel_errmsg_1(text);
}

}  // namespace acl
