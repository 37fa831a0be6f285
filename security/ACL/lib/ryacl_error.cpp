// Recording and reporting errors through the default message table.
#include "ryacl_error.h"

#include <atomic>
#include <cstdio>

#include "ry_zo_int.h"

namespace acl {

const char *msg_text(int32_t msgnum) {
    if (msgnum < 0 || msgnum >= RYSECLIB_MSG_COUNT) return zo_badid_ryseclib_msg;
    return zo_mesgtbl_ryseclib_msg[msgnum];
}

namespace {

// The positions each table text uses, scanned at its first use: 0 not yet,
// else the used-position bits, the highest position above them and a
// marker bit.  Racing threads scan alike and store the same value.
std::atomic<uint32_t> g_positions[RYSECLIB_MSG_COUNT];
constexpr uint32_t kScanned = 1u << 31;

zo::arg_positions positions_of(int32_t msgnum, const char *text) {
    if (msgnum < 0 || msgnum >= RYSECLIB_MSG_COUNT) return zo::scan_arg_positions(text);
    uint32_t v = g_positions[msgnum].load(std::memory_order_relaxed);
    if (!v) {
        const zo::arg_positions p = zo::scan_arg_positions(text);
        v = kScanned | (p.highest << 16) | (p.used & 0xffffu);
        g_positions[msgnum].store(v, std::memory_order_relaxed);
    }
    return {v & 0xffffu, (v >> 16) & 0xffu};
}

}  // namespace

int32_t set_error_list(int32_t rc, int32_t msgnum, std::initializer_list<err_arg> args) {
    zo_error_arg_t argv[16];
    unsigned n = 0;
    for (const err_arg &a : args) {
        if (n == 16) break;
        argv[n++] = a.a;
    }
    // The catalog name and the table's texts live for the process: the
    // error record refers to them instead of copying a kilobyte of text
    // for every failure, a miss of an evaluation included.
    const char *text = msg_text(msgnum);
    zo::set_error_static(rc, RYSECLIB_CAT, RYSECLIB_SET, msgnum, text, positions_of(msgnum, text), n, argv);
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
