// The ACL text parser: one line per call, in place, no allocation.
#include <langinfo.h>

#include <bit>
#include <cctype>
#include <clocale>
#include <cstdint>
#include <cstring>

#include "ry_zo_int.h"
#include "ryacl_acl_entry.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

namespace {

// Longest line, its terminator (or the text's final NUL) counted.
constexpr size_t LINE_MAX_BYTES = 1096;
constexpr size_t MECH_MAX = 16;

// Byte classes of the syntax, one table lookup per byte.
enum : unsigned char { C_TERM = 1, C_NUL = 2, C_BLANK = 4, C_HASH = 8, C_TOKEN = 16 };
constexpr unsigned char C_LINE_END = C_TERM | C_NUL;
constexpr unsigned char C_END_MARK = C_TERM | C_NUL | C_HASH;

// The classes of the calling thread's locale.  Token characters depend on
// its isspace; locale space bytes that are neither blanks nor terminators
// separate tokens like blanks, so a token is never empty.  The table is
// built through the public isspace once per LC_CTYPE locale a thread
// parses in, and found again by the locale's name, which follows both
// setlocale and uselocale.
class class_table {
public:
    const unsigned char *current() {
        const char *name = nl_langinfo(NL_LOCALE_NAME(LC_CTYPE));
        if (!name) name = "";
        if (!built_ || !same_name(name)) build(name);
        return cls_;
    }

private:
    // Locale names are a few bytes: a loop beats a call.
    bool same_name(const char *name) const {
        size_t i = 0;
        for (; name_[i] == name[i]; ++i)
            if (name[i] == '\0') return true;
        return false;
    }

    void build(const char *name) {
        for (unsigned b = 0; b < 256; ++b) {
            unsigned char c = 0;
            if (b == '\n' || b == '\f' || b == '\r') c = C_TERM;
            else if (b == 0) c = C_NUL;
            else if (b == ' ' || b == '\t' || b == '\v' || std::isspace(static_cast<int>(b))) c = C_BLANK;
            else c = C_TOKEN;
            if (b == '#') c |= C_HASH;
            cls_[b] = c;
        }
        // A name too long to keep is compared on its first bytes only, so
        // it is rebuilt on every call rather than taken for another locale.
        built_ = std::strlen(name) < sizeof name_;
        std::strncpy(name_, name, sizeof name_ - 1);
    }
    unsigned char cls_[256] = {};
    char name_[128] = {};
    bool built_ = false;
};

thread_local class_table t_classes;

struct classifier {
    const unsigned char *c;

    bool token(unsigned char b) const { return c[b] & C_TOKEN; }
    bool blank(unsigned char b) const { return c[b] & C_BLANK; }
    bool end_mark(unsigned char b) const { return c[b] & C_END_MARK; }
    bool line_end(unsigned char b) const { return c[b] & C_LINE_END; }
};

// Parse state of one line.  Every scan stops at the text's final NUL, which
// the caller's length promises (and the entry point checks), so no scan
// needs a bound of its own.
struct line_parser {
    classifier cl;
    unsigned char *p;                // next byte to look at, never past the line's end
    const unsigned char *limit;      // the text's end, just past its final NUL
    unsigned char *end = nullptr;    // the line's terminator, once met
    bool last = false;               // the line ends at a NUL
    size_t mechlen = 0, idlen = 0;   // of the entry's mechanism and identifier

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

    // Past the token bytes at p.  Eight bytes at a time while they are
    // plainly token bytes (0x21 to 0x7f, whatever the locale), each other
    // byte asked of the table; never a load past the text's end.
    void skip_token() {
        if constexpr (std::endian::native == std::endian::little) {
            while (p + 8 <= limit) {
                const uint64_t x = zo::load8(reinterpret_cast<const char *>(p));
                // High bit of each byte below 0x21 or above 0x7f; exact up
                // to the first such byte, which is all that is used.
                const uint64_t m = ((x - 0x2121212121212121ull) | x) & 0x8080808080808080ull;
                if (!m) {
                    p += 8;
                    continue;
                }
                p += std::countr_zero(m) / 8;
                if (!cl.token(*p)) return;
                ++p;
            }
        }
        while (cl.token(*p)) ++p;
    }

    token read_token() {
        unsigned char *s = p;
        skip_token();
        token t{reinterpret_cast<char *>(s), static_cast<size_t>(p - s), cl.line_end(*p)};
        if (t.ends_line) note_end(p);
        *p = '\0';
        if (!t.ends_line) ++p;
        return t;
    }

    // After a token that did not end the line: skip blanks; true when an end
    // mark follows (the line end is noted unless it is a comment).
    bool at_end_mark() {
        while (cl.blank(*p)) ++p;
        if (!cl.end_mark(*p)) return false;
        if (cl.line_end(*p)) note_end(p);
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

fault missing() { return {ACL_RC_BAD_ACL, acl::msg::LINE_TOO_FEW_TOKENS.num, nullptr}; }
fault extra() { return {ACL_RC_BAD_ACL, acl::msg::LINE_TOO_MANY_TOKENS.num, nullptr}; }

// The permission token, then nothing but a comment.
fault permissions(line_parser &lp, const sec_perm_set_desc *permset, sec_acle_t acle) {
    line_parser::token t = lp.read_token();
    if (sec__translate_perms(t.s, permset, &acle->perm) != ACL_RC_OK)
        return {ACL_RC_PERMISSION, acl::msg::LINE_BAD_PERMS.num, t.s};
    if (t.ends_line || lp.at_end_mark()) return {};
    return extra();
}

// The tokens of one line into acle.
fault parse_entry(line_parser &lp, const sec_perm_set_desc *permset, sec_acle_t acle) {
    if (lp.at_end_mark()) return {};  // blank or comment line

    line_parser::token t = lp.read_token();
    const unsigned char type = type_code(t);
    if (!type) return {ACL_RC_BAD_ACL, acl::msg::LINE_BAD_TYPE.num, t.s};
    acle->type = type;
    const bool no_names = !acl__type_has_id(type);  // unauthenticated, anyother

    if (t.ends_line || lp.at_end_mark()) return no_names ? fault{} : missing();
    if (no_names) return permissions(lp, permset, acle);

    t = lp.read_token();
    if (type == SEC_ACLE_TYPE_GROUP) {
        acle->id = t.s;
        lp.idlen = t.len;
    } else {
        lp.mechlen = t.len;
        if (t.len > MECH_MAX) return {ACL_RC_BAD_ACL, acl::msg::LINE_MECH_TOO_LONG.num, t.s};
        for (size_t i = 0; i < t.len; ++i) {
            t.s[i] = static_cast<char>(zo::fold(static_cast<unsigned char>(t.s[i])));
            acle->mech[i] = t.s[i];
        }
    }
    if (t.ends_line || lp.at_end_mark())
        return type == SEC_ACLE_TYPE_GROUP ? fault{} : missing();
    if (type == SEC_ACLE_TYPE_GROUP) return permissions(lp, permset, acle);

    t = lp.read_token();
    acle->id = t.s;
    lp.idlen = t.len;
    if (t.ends_line || lp.at_end_mark()) return {};
    return permissions(lp, permset, acle);
}

}  // namespace

const unsigned char *acl__line_classes() { return t_classes.current(); }

int32_t acl__read_acle_deferred(const sec_perm_set_desc *permset, char **tacl, size_t *length, int32_t *lineno,
                                sec_acle_t acle, acl__line_fault *out, acl__line_ctx *ctx) {
    std::memset(acle, 0, sizeof *acle);
    char *const start = *tacl;
    const size_t remaining = *length;
    // A NUL at the cursor is the end only when it is the text's final one;
    // an earlier one is a stray NUL, reported below as its line's fault.
    if (!start || remaining == 0) return 0;
    const int32_t line = *lineno;
    fault f;
    size_t consumed = 0;
    if (start[remaining - 1] != '\0') {
        // A text whose length does not end at a NUL would have every scan
        // run off its end; it is refused as corrupted, and consumed whole.
        f = {ACL_RC_BAD_ACL, acl::msg::LINE_CORRUPTED.num, nullptr};
        *tacl = nullptr;
        *length = 0;
    } else {
        if (remaining == 1) return 0;
        if (!permset) permset = &acl__default_perm_set;

        line_parser lp{classifier{ctx && ctx->classes ? ctx->classes : acl__line_classes()},
                       reinterpret_cast<unsigned char *>(start),
                       reinterpret_cast<const unsigned char *>(start) + remaining};
        f = parse_entry(lp, permset, acle);
        if (ctx) {
            ctx->mechlen = lp.mechlen;
            ctx->idlen = lp.idlen;
        }
        lp.find_end();

        consumed = static_cast<size_t>(lp.end - reinterpret_cast<unsigned char *>(start)) + 1;
        if (consumed > LINE_MAX_BYTES) f = {ACL_RC_FILE_ERROR, acl::msg::LINE_TOO_LONG.num, nullptr};
        if (lp.last) {
            // Nothing after a NUL is parsed, so the text is used up either way.
            if (f.rc == ACL_RC_OK && consumed != remaining) f = {ACL_RC_BAD_ACL, acl::msg::LINE_CORRUPTED.num, nullptr};
            *tacl = nullptr;
            *length = 0;
        } else {
            *tacl = start + consumed;
            *length = remaining - consumed;
        }
    }
    if (*lineno < INT32_MAX) ++*lineno;
    if (f.rc == ACL_RC_OK) return 1;
    *out = {f.rc, f.msg, line, f.token, consumed};
    return f.rc;
}

int32_t acl__record_line_fault(const acl__line_fault &f) {
    if (f.msg == acl::msg::LINE_TOO_LONG.num) {
        const int32_t len32 = f.length > INT32_MAX ? INT32_MAX : static_cast<int32_t>(f.length);
        acl::trace::point(acl::trace::ERRORS, 115, {acl::trace::val(f.line), acl::trace::val(len32)});
    }
    // A permission token that did not translate left message 133 behind;
    // the line's own message replaces it.
    acl::clear_error();
    // Each message by name, so its arguments are checked where it is recorded.
    using namespace acl::msg;
    switch (f.msg) {
    case LINE_MECH_TOO_LONG.num: return acl::set_error(f.rc, LINE_MECH_TOO_LONG, f.token, f.line);
    case LINE_BAD_TYPE.num: return acl::set_error(f.rc, LINE_BAD_TYPE, f.line, f.token);
    case LINE_BAD_PERMS.num: return acl::set_error(f.rc, LINE_BAD_PERMS, f.line, f.token);
    case LINE_TOO_FEW_TOKENS.num: return acl::set_error(f.rc, LINE_TOO_FEW_TOKENS, f.line);
    case LINE_TOO_MANY_TOKENS.num: return acl::set_error(f.rc, LINE_TOO_MANY_TOKENS, f.line);
    case LINE_TOO_LONG.num: return acl::set_error(f.rc, LINE_TOO_LONG, f.line);
    default: return acl::set_error(f.rc, LINE_CORRUPTED, f.line);
    }
}

int32_t sec__read_acle_from_text(const sec_perm_set_desc *permset, char **tacl, size_t *length,
                                 int32_t *lineno, sec_acle_t acle) {
    acl__line_fault f;
    const int32_t rc = acl__read_acle_deferred(permset, tacl, length, lineno, acle, &f);
    return rc == 0 || rc == 1 ? rc : acl__record_line_fault(f);
}
