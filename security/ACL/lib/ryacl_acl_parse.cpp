// The ACL text parser: one line per call, in place, no allocation.
#include <cctype>
#include <cstdint>
#include <cstring>

#include "ry_zo_int.h"
#include "ryacl_acl_entry.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

#ifndef __GLIBC__
#error "the parser classifies bytes through the C library's ctype table"
#endif

namespace {

// Longest line, its terminator (or the text's final NUL) counted.
constexpr size_t LINE_MAX_BYTES = 1096;
constexpr size_t MECH_MAX = 16;

// Fixed byte classes of the syntax.
enum : unsigned char { C_TERM = 1, C_NUL = 2, C_BLANK = 4, C_HASH = 8 };
constexpr unsigned char C_LINE_END = C_TERM | C_NUL;
constexpr unsigned char C_END_MARK = C_TERM | C_NUL | C_HASH;

struct class_table {
    unsigned char c[256] = {};
    constexpr class_table() {
        for (unsigned char b : {'\n', '\f', '\r'}) c[b] = C_TERM;
        for (unsigned char b : {' ', '\t', '\v'}) c[b] = C_BLANK;
        c[0] = C_NUL;
        c[static_cast<unsigned char>('#')] = C_HASH;
    }
};
constexpr class_table k_cls;

// Classification for one call.  Token characters depend on the locale's
// isspace.  glibc's isspace is itself a lookup in the calling thread's ctype
// table; taking that table once per call follows setlocale and uselocale
// with no cache to invalidate and no per-byte call.  Locale space bytes that
// are neither blanks nor terminators separate tokens like blanks, so a token
// is never empty.
struct classifier {
    const unsigned short *ct = *__ctype_b_loc();

    static unsigned char fixed(unsigned char b) { return k_cls.c[b]; }
    bool space(unsigned char b) const { return ct[b] & static_cast<unsigned short>(_ISspace); }
    bool token(unsigned char b) const { return !(fixed(b) & C_LINE_END) && !space(b); }
    bool blank(unsigned char b) const {
        return (fixed(b) & C_BLANK) || (space(b) && !(fixed(b) & C_LINE_END));
    }
    static bool end_mark(unsigned char b) { return fixed(b) & C_END_MARK; }
    static bool line_end(unsigned char b) { return fixed(b) & C_LINE_END; }
};

// Parse state of one line.  Every scan stops at the text's final NUL, which
// the caller's length promises (and the entry point checks), so no scan
// needs a bound of its own.
struct line_parser {
    classifier cl;
    unsigned char *p;                // next byte to look at, never past the line's end
    unsigned char *end = nullptr;    // the line's terminator, once met
    bool last = false;               // the line ends at a NUL

    // A token runs up to its first non-token byte, which becomes its NUL.
    struct token {
        char *s;
        size_t len;
        bool ends_line;
    };

    // Called before a token's end is overwritten, so `last` sees the byte
    // that was there.
    void note_end(unsigned char *at) {
        end = at;
        last = *at == '\0';
    }

    token read_token() {
        unsigned char *s = p;
        while (cl.token(*p)) ++p;
        token t{reinterpret_cast<char *>(s), static_cast<size_t>(p - s), classifier::line_end(*p)};
        if (t.ends_line) note_end(p);
        *p = '\0';
        if (!t.ends_line) ++p;
        return t;
    }

    // After a token that did not end the line: skip blanks; true when an end
    // mark follows (the line end is noted unless it is a comment).
    bool at_end_mark() {
        while (cl.blank(*p)) ++p;
        if (!classifier::end_mark(*p)) return false;
        if (classifier::line_end(*p)) note_end(p);
        return true;
    }

    // The line's end when a comment or a fault stopped the parse short of it.
    void find_end() {
        if (end) return;
        // strcspn stops at the NUL too, and is vectorised in glibc.
        unsigned char *e = p + std::strcspn(reinterpret_cast<char *>(p), "\n\f\r");
        note_end(e);
    }
};

struct fault {
    int32_t rc = ACL_RC_OK;
    int32_t msg = 0;
    const char *token = nullptr;  // argument of messages 132, 165, 166
};

unsigned char type_code(const line_parser::token &t) {
    if (t.len != 1) return 0;
    switch (t.s[0]) {
    case 'n': case 'N': return SEC_ACLE_TYPE_UNAUTHENTICATED;
    case 'o': case 'O': return SEC_ACLE_TYPE_ANYOTHER;
    case 'u': case 'U': return SEC_ACLE_TYPE_USER;
    case 'e': case 'E': return SEC_ACLE_TYPE_EXPANDED;
    case 'g': case 'G': return SEC_ACLE_TYPE_GROUP;
    default: return 0;
    }
}

fault missing() { return {ACL_RC_BAD_ACL, 158, nullptr}; }
fault extra() { return {ACL_RC_BAD_ACL, 159, nullptr}; }

// The permission token, then nothing but a comment.
fault permissions(line_parser &lp, const sec_perm_set_desc *permset, sec_acle_t acle) {
    line_parser::token t = lp.read_token();
    if (sec__translate_perms(t.s, permset, &acle->perm) != ACL_RC_OK)
        return {ACL_RC_PERMISSION, 166, t.s};
    if (t.ends_line || lp.at_end_mark()) return {};
    return extra();
}

// The tokens of one line into acle.
fault parse_entry(line_parser &lp, const sec_perm_set_desc *permset, sec_acle_t acle) {
    if (lp.at_end_mark()) return {};  // blank or comment line

    line_parser::token t = lp.read_token();
    const unsigned char type = type_code(t);
    if (!type) return {ACL_RC_BAD_ACL, 165, t.s};
    acle->type = type;
    const bool no_names = !acl__type_has_id(type);  // unauthenticated, anyother

    if (t.ends_line || lp.at_end_mark()) return no_names ? fault{} : missing();
    if (no_names) return permissions(lp, permset, acle);

    t = lp.read_token();
    if (type == SEC_ACLE_TYPE_GROUP) {
        acle->id = t.s;
    } else {
        if (t.len > MECH_MAX) return {ACL_RC_BAD_ACL, 132, t.s};
        for (size_t i = 0; i < t.len; ++i) {
            t.s[i] = static_cast<char>(zo_tolower_posix_1(static_cast<unsigned char>(t.s[i])));
            acle->mech[i] = t.s[i];
        }
    }
    if (t.ends_line || lp.at_end_mark())
        return type == SEC_ACLE_TYPE_GROUP ? fault{} : missing();
    if (type == SEC_ACLE_TYPE_GROUP) return permissions(lp, permset, acle);

    t = lp.read_token();
    acle->id = t.s;
    if (t.ends_line || lp.at_end_mark()) return {};
    return permissions(lp, permset, acle);
}

// A text whose length does not end at a NUL would have every scan run off
// its end; it is refused as corrupted, and consumed whole.
int32_t refuse_unterminated(char **tacl, size_t *length, int32_t *lineno) {
    int32_t rc = acl::set_error(ACL_RC_BAD_ACL, acl::msg::LINE_CORRUPTED, *lineno);
    *tacl = nullptr;
    *length = 0;
    if (*lineno < INT32_MAX) ++*lineno;
    return rc;
}

}  // namespace

int32_t sec__read_acle_from_text(const sec_perm_set_desc *permset, char **tacl, size_t *length,
                                 int32_t *lineno, sec_acle_t acle) {
    std::memset(acle, 0, sizeof *acle);
    char *const start = *tacl;
    const size_t remaining = *length;
    // A NUL at the cursor is the end only when it is the text's final one;
    // an earlier one is a stray NUL, reported below as its line's fault.
    if (!start || remaining == 0) return 0;
    if (start[remaining - 1] != '\0') return refuse_unterminated(tacl, length, lineno);
    if (remaining == 1) return 0;
    if (!permset) permset = &acl__default_perm_set;

    line_parser lp{classifier{}, reinterpret_cast<unsigned char *>(start)};
    fault f = parse_entry(lp, permset, acle);
    lp.find_end();

    const size_t consumed = static_cast<size_t>(lp.end - reinterpret_cast<unsigned char *>(start)) + 1;
    const int32_t line = *lineno;
    if (consumed > LINE_MAX_BYTES) {
        const int32_t len32 = consumed > INT32_MAX ? INT32_MAX : static_cast<int32_t>(consumed);
        acl::trace::point(acl::trace::ERRORS, 115, {acl::trace::val(line), acl::trace::val(len32)});
        f = {ACL_RC_FILE_ERROR, 145, nullptr};
    }
    if (lp.last) {
        // Nothing after a NUL is parsed, so the text is used up either way.
        if (f.rc == ACL_RC_OK && consumed != remaining) f = {ACL_RC_BAD_ACL, 131, nullptr};
        *tacl = nullptr;
        *length = 0;
    } else {
        *tacl = start + consumed;
        *length = remaining - consumed;
    }
    if (*lineno < INT32_MAX) ++*lineno;

    if (f.rc == ACL_RC_OK) return 1;
    // A permission token that did not translate left message 133 behind;
    // the line's own message replaces it.
    acl::clear_error();
    switch (f.msg) {
    case 132: return acl::set_error(f.rc, f.msg, f.token, line);
    case 165: case 166: return acl::set_error(f.rc, f.msg, line, f.token);
    default: return acl::set_error(f.rc, f.msg, line);
    }
}
