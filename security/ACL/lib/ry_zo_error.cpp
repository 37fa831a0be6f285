// Error records: the per-thread error slot, copies of it, and formatting a
// record through the message catalog with positional placeholders.
#include <dlfcn.h>
#include <locale.h>
#include <nl_types.h>
#include <pthread.h>

#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "ry_zo.h"

namespace {

constexpr unsigned kMaxPositions = 16;   // messages use at most 6
constexpr size_t kTextCap = 4096;        // longest default text is ~1.1 KiB
constexpr size_t kStringCap = 16384;     // room for a few full paths
constexpr size_t kCatCap = 256;
constexpr int kMaxWidth = 4096;          // bound on widths a catalog may ask for

// The slot holds everything inline: recording an error never allocates, so
// it works when memory is exhausted (the very failure it often reports).
struct error_slot {
    bool set = false;
    int32_t id = 0;
    int32_t msg_set = 0;
    int32_t msg_num = 0;
    uint32_t argc = 0;
    zo_error_arg_t args[kMaxPositions];
    char cat[kCatCap];
    char text[kTextCap];
    char strings[kStringCap];
    size_t strings_used = 0;
};

thread_local error_slot t_slot;

void copy_bounded(char *dst, size_t cap, const char *src) {
    if (!src) src = "";
    size_t n = std::strlen(src);
    if (n >= cap) n = cap - 1;
    std::memcpy(dst, src, n);
    dst[n] = '\0';
}

// Copy a string argument into the slot's own storage; a text that no longer
// fits is cut short rather than dropped.
char *slot_string(error_slot &s, const char *src) {
    if (!src) src = "";
    size_t room = kStringCap - s.strings_used;
    if (room == 0) return s.strings + kStringCap - 1;  // the final NUL
    size_t n = std::strlen(src);
    if (n >= room) n = room - 1;
    char *dst = s.strings + s.strings_used;
    std::memcpy(dst, src, n);
    dst[n] = '\0';
    s.strings_used += n + 1;
    return dst;
}

// One placeholder "%N$[flags][width][.prec][length]conv".
struct placeholder {
    size_t begin = 0, end = 0;  // the span in the text
    unsigned pos = 0;           // 1-based position
    std::string directive;      // "%" flags width prec length conv, without "N$"
    char conv = 0;
    int length = 0;             // 0 none, 1 'l', 2 "ll", -1 'h'
};

bool parse_placeholder(std::string_view t, size_t i, placeholder &ph) {
    // t[i] == '%'
    size_t j = i + 1;
    unsigned pos = 0;
    size_t digits = 0;
    while (j < t.size() && t[j] >= '0' && t[j] <= '9' && digits < 4) pos = pos * 10 + (t[j++] - '0'), ++digits;
    if (digits == 0 || pos == 0 || j >= t.size() || t[j] != '$') return false;
    ++j;
    std::string directive = "%";
    while (j < t.size() && std::strchr("-+ #0", t[j])) directive += t[j++];
    int width = 0;
    while (j < t.size() && t[j] >= '0' && t[j] <= '9') {
        width = width * 10 + (t[j] - '0');
        if (width > kMaxWidth) width = kMaxWidth;
        ++j;
    }
    if (width) directive += std::to_string(width);
    if (j < t.size() && t[j] == '.') {
        ++j;
        int prec = 0;
        while (j < t.size() && t[j] >= '0' && t[j] <= '9') {
            prec = prec * 10 + (t[j] - '0');
            if (prec > kMaxWidth) prec = kMaxWidth;
            ++j;
        }
        directive += '.';
        directive += std::to_string(prec);
    }
    int length = 0;
    if (j < t.size() && t[j] == 'h') length = -1, ++j;
    else if (j + 1 < t.size() && t[j] == 'l' && t[j + 1] == 'l') length = 2, j += 2;
    else if (j < t.size() && t[j] == 'l') length = 1, ++j;
    if (j >= t.size() || !std::strchr("sdiuxXcfgeEp", t[j])) return false;
    ph.conv = t[j];
    ph.begin = i;
    ph.end = j + 1;
    ph.pos = pos;
    ph.length = length;
    ph.directive = directive;
    return true;
}

// Visit every placeholder of a text; "%%" is skipped.
template <class F>
void for_each_placeholder(std::string_view t, F &&f) {
    for (size_t i = 0; i < t.size(); ++i) {
        if (t[i] != '%') continue;
        if (i + 1 < t.size() && t[i + 1] == '%') { ++i; continue; }
        placeholder ph;
        if (parse_placeholder(t, i, ph)) {
            f(ph);
            i = ph.end - 1;
        }
    }
}

// Kind and presence of each position a text uses.
struct positions {
    char conv[kMaxPositions + 1] = {};
    int length[kMaxPositions + 1] = {};
    unsigned highest = 0;
};

positions scan_positions(const char *text) {
    positions p;
    for_each_placeholder(text ? std::string_view(text) : std::string_view(), [&](const placeholder &ph) {
        if (ph.pos > kMaxPositions) return;
        if (!p.conv[ph.pos]) p.conv[ph.pos] = ph.conv, p.length[ph.pos] = ph.length;
        if (ph.pos > p.highest) p.highest = ph.pos;
    });
    return p;
}

void slot_begin(error_slot &s, int error_id, const char *msg_cat, int msg_set, int msg_num,
                const char *msg_default) {
    s.set = true;
    s.id = error_id;
    s.msg_set = msg_set;
    s.msg_num = msg_num;
    s.strings_used = 0;
    copy_bounded(s.cat, kCatCap, msg_cat);
    copy_bounded(s.text, kTextCap, msg_default);
    for (auto &a : s.args) {
        a.zo_arg_type = ZO_ERROR_ARG_RESERVED;
        a.zo_arg_value.zo_arg_long_long = 0;
    }
}

void store_arg(error_slot &s, unsigned pos, const zo_error_arg_t &a) {
    zo_error_arg_t &d = s.args[pos - 1];
    d = a;
    if (a.zo_arg_type == ZO_ERROR_ARG_CHAR_STR) d.zo_arg_value.zo_arg_char_str = slot_string(s, a.zo_arg_value.zo_arg_char_str);
}

// ---- Catalog lookup ------------------------------------------------------

struct open_catalog {
    std::string name;
    std::string locale;
    nl_catd catd;
};
pthread_mutex_t g_cat_mutex = PTHREAD_MUTEX_INITIALIZER;
std::vector<open_catalog> *g_catalogs = nullptr;  // lives for the process

// Directory of the library or program image this code is in, so that an
// installed tree finds <prefix>/share/ryacl/ without root or NLSPATH.
std::string image_dir() {
    Dl_info info{};
    if (!dladdr(reinterpret_cast<void *>(&zo_get_errmsg_1), &info) || !info.dli_fname) return {};
    std::string p = info.dli_fname;
    size_t slash = p.rfind('/');
    return slash == std::string::npos ? std::string(".") : p.substr(0, slash);
}

nl_catd try_open(const std::string &path) {
    nl_catd c = catopen(path.c_str(), NL_CAT_LOCALE);
    return c;
}

// Search order: NLSPATH when the user set it; then, beside the image,
// share/ryacl/nls/<locale>/NAME, .../<language>/NAME and share/ryacl/NAME;
// then the system's default catalog path.
nl_catd find_catalog(const std::string &name, const std::string &locale) {
    if (name.find('/') != std::string::npos) return try_open(name);
    if (std::getenv("NLSPATH")) {
        nl_catd c = catopen(name.c_str(), NL_CAT_LOCALE);
        if (c != reinterpret_cast<nl_catd>(-1)) return c;
    }
    std::string dir = image_dir();
    if (!dir.empty()) {
        std::string lang = locale.substr(0, locale.find_first_of("_.@"));
        for (const char *up : {"/../share/ryacl/", "/../../share/ryacl/"}) {
            std::string base = dir + up;
            std::vector<std::string> cands;
            if (!locale.empty() && locale != "C" && locale != "POSIX") {
                cands.push_back(base + "nls/" + locale + "/" + name);
                if (lang != locale) cands.push_back(base + "nls/" + lang + "/" + name);
            }
            cands.push_back(base + name);
            for (const auto &c : cands) {
                nl_catd catd = try_open(c);
                if (catd != reinterpret_cast<nl_catd>(-1)) return catd;
            }
        }
    }
    return catopen(name.c_str(), NL_CAT_LOCALE);
}

// The catalog's text for (set, num), or null.  Catalogs are opened once per
// name and locale and kept open.
const char *catalog_text(const char *cat, int set, int num) {
    if (!cat || !*cat) return nullptr;
    const char *loc = setlocale(LC_MESSAGES, nullptr);
    std::string locale = loc ? loc : "C";
    const char *result = nullptr;
    pthread_mutex_lock(&g_cat_mutex);
    try {
        if (!g_catalogs) g_catalogs = new std::vector<open_catalog>();
        nl_catd catd = reinterpret_cast<nl_catd>(-1);
        bool found = false;
        for (const auto &c : *g_catalogs) {
            if (c.name == cat && c.locale == locale) { catd = c.catd; found = true; break; }
        }
        if (!found) {
            catd = find_catalog(cat, locale);
            g_catalogs->push_back({cat, locale, catd});
        }
        if (catd != reinterpret_cast<nl_catd>(-1)) {
            static const char kMissing[] = "";
            const char *t = catgets(catd, set, num, kMissing);
            if (t && t != kMissing) result = t;
        }
    } catch (...) {
        result = nullptr;  // out of memory: the default text serves
    }
    pthread_mutex_unlock(&g_cat_mutex);
    return result;
}

// ---- Formatting ----------------------------------------------------------

void append_formatted(std::string &out, const placeholder &ph, const zo_error_t &rec) {
    if (ph.pos > rec.zo_arg_cnt || !rec.zo_args) return;  // never passed: nothing
    const zo_error_arg_t &a = rec.zo_args[ph.pos - 1];
    char buf[kMaxWidth + 64];
    int n = -1;
    const bool wants_text = ph.conv == 's';
    switch (a.zo_arg_type) {
    case ZO_ERROR_ARG_CHAR_STR: {
        const char *s = a.zo_arg_value.zo_arg_char_str ? a.zo_arg_value.zo_arg_char_str : "";
        if (wants_text) {
            // Width and precision apply, the text may be long: format it
            // straight into the output.
            std::string directive = ph.directive + "s";
            int need = std::snprintf(nullptr, 0, directive.c_str(), s);
            if (need > 0) {
                std::string tmp(static_cast<size_t>(need) + 1, '\0');
                std::snprintf(tmp.data(), tmp.size(), directive.c_str(), s);
                out.append(tmp.data(), static_cast<size_t>(need));
            }
        } else {
            out += s;  // a text where a number was expected: show the text
        }
        return;
    }
    case ZO_ERROR_ARG_INT:
    case ZO_ERROR_ARG_LONG:
    case ZO_ERROR_ARG_LONG_LONG: {
        long long v = a.zo_arg_type == ZO_ERROR_ARG_INT    ? a.zo_arg_value.zo_arg_int
                      : a.zo_arg_type == ZO_ERROR_ARG_LONG ? a.zo_arg_value.zo_arg_long
                                                           : a.zo_arg_value.zo_arg_long_long;
        if (ph.conv == 'c') {
            n = std::snprintf(buf, sizeof buf, (ph.directive + "c").c_str(), static_cast<int>(static_cast<unsigned char>(v)));
        } else if (std::strchr("dixXu", ph.conv)) {
            // The value keeps the width it was recorded with: an int printed
            // with "%x" shows its 32 bits, not a sign-extended 64.
            if (a.zo_arg_type == ZO_ERROR_ARG_INT) {
                std::string directive = ph.directive + std::string(1, ph.conv);
                n = std::snprintf(buf, sizeof buf, directive.c_str(), static_cast<int>(v));
            } else {
                std::string directive = ph.directive + "ll" + std::string(1, ph.conv);
                n = std::snprintf(buf, sizeof buf, directive.c_str(), v);
            }
        } else {
            n = std::snprintf(buf, sizeof buf, "%lld", v);
        }
        break;
    }
    case ZO_ERROR_ARG_DOUBLE:
        if (std::strchr("fgeE", ph.conv)) n = std::snprintf(buf, sizeof buf, (ph.directive + ph.conv).c_str(), a.zo_arg_value.zo_arg_double);
        else n = std::snprintf(buf, sizeof buf, "%g", a.zo_arg_value.zo_arg_double);
        break;
    case ZO_ERROR_ARG_VOID_PTR:
        n = std::snprintf(buf, sizeof buf, "%p", a.zo_arg_value.zo_arg_void_ptr);
        break;
    default:
        return;  // a skipped position has no value
    }
    if (n > 0) out.append(buf, static_cast<size_t>(n) < sizeof buf ? static_cast<size_t>(n) : sizeof buf - 1);
}

std::string format_record(const char *tmpl, const zo_error_t &rec) {
    std::string out;
    std::string_view t(tmpl);
    size_t last = 0;
    for (size_t i = 0; i < t.size(); ++i) {
        if (t[i] != '%') continue;
        if (i + 1 < t.size() && t[i + 1] == '%') {
            out.append(t.substr(last, i - last));
            out += '%';
            last = i + 2;
            ++i;
            continue;
        }
        placeholder ph;
        if (!parse_placeholder(t, i, ph)) continue;  // a lone '%' stays as it is
        out.append(t.substr(last, i - last));
        append_formatted(out, ph, rec);
        last = ph.end;
        i = ph.end - 1;
    }
    out.append(t.substr(last));
    return out;
}

}  // namespace

extern "C" {

int zo_set_error_1(int error_id, const char *ffdc_id, const char *msg_cat, int msg_set, int msg_num,
                   const char *msg_default, ...) {
    (void)ffdc_id;  // first-failure data is not kept by this layer
    error_slot &s = t_slot;
    slot_begin(s, error_id, msg_cat, msg_set, msg_num, msg_default);
    positions p = scan_positions(s.text);
    va_list ap;
    va_start(ap, msg_default);
    for (unsigned pos = 1; pos <= p.highest; ++pos) {
        char c = p.conv[pos];
        if (!c) continue;  // a skipped position consumes no argument
        zo_error_arg_t a{};
        if (c == 's') {
            a.zo_arg_type = ZO_ERROR_ARG_CHAR_STR;
            a.zo_arg_value.zo_arg_char_str = va_arg(ap, char *);
        } else if (c == 'p') {
            a.zo_arg_type = ZO_ERROR_ARG_VOID_PTR;
            a.zo_arg_value.zo_arg_void_ptr = va_arg(ap, void *);
        } else if (std::strchr("fgeE", c)) {
            a.zo_arg_type = ZO_ERROR_ARG_DOUBLE;
            a.zo_arg_value.zo_arg_double = va_arg(ap, double);
        } else if (p.length[pos] == 2) {
            a.zo_arg_type = ZO_ERROR_ARG_LONG_LONG;
            a.zo_arg_value.zo_arg_long_long = va_arg(ap, long long);
        } else if (p.length[pos] == 1) {
            a.zo_arg_type = ZO_ERROR_ARG_LONG;
            a.zo_arg_value.zo_arg_long = va_arg(ap, long);
        } else {
            a.zo_arg_type = ZO_ERROR_ARG_INT;
            a.zo_arg_value.zo_arg_int = va_arg(ap, int);
        }
        store_arg(s, pos, a);
    }
    va_end(ap);
    s.argc = p.highest;
    return 0;
}

int zo_set_error_argv_1(int error_id, const char *ffdc_id, const char *msg_cat, int msg_set,
                        int msg_num, const char *msg_default, unsigned argc,
                        const zo_error_arg_t *argv) {
    (void)ffdc_id;
    error_slot &s = t_slot;
    slot_begin(s, error_id, msg_cat, msg_set, msg_num, msg_default);
    positions p = scan_positions(s.text);
    unsigned next = 0;
    for (unsigned pos = 1; pos <= p.highest; ++pos) {
        if (!p.conv[pos]) continue;
        if (next < argc && argv) store_arg(s, pos, argv[next]);
        ++next;
    }
    s.argc = p.highest;
    return 0;
}

int zo_set_no_error_1(void) {
    t_slot.set = false;
    return 0;
}

int zo_get_error_1(zo_error_t **record) {
    if (!record) return 4;
    *record = nullptr;
    const error_slot &s = t_slot;
    if (!s.set) return 0;
    // One block: the record, its arguments, then every text.
    size_t textlen = std::strlen(s.text) + 1, catlen = std::strlen(s.cat) + 1;
    size_t size = sizeof(zo_error_t) + sizeof(zo_error_arg_t) * s.argc + textlen + catlen;
    for (unsigned i = 0; i < s.argc; ++i)
        if (s.args[i].zo_arg_type == ZO_ERROR_ARG_CHAR_STR) size += std::strlen(s.args[i].zo_arg_value.zo_arg_char_str) + 1;
    auto *block = static_cast<unsigned char *>(std::malloc(size));
    if (!block) return 6;
    auto *rec = reinterpret_cast<zo_error_t *>(block);
    auto *args = reinterpret_cast<zo_error_arg_t *>(block + sizeof(zo_error_t));
    char *text = reinterpret_cast<char *>(args + s.argc);
    std::memcpy(text, s.text, textlen);
    char *cat = text + textlen;
    std::memcpy(cat, s.cat, catlen);
    char *strings = cat + catlen;
    for (unsigned i = 0; i < s.argc; ++i) {
        args[i] = s.args[i];
        if (args[i].zo_arg_type == ZO_ERROR_ARG_CHAR_STR) {
            size_t n = std::strlen(s.args[i].zo_arg_value.zo_arg_char_str) + 1;
            std::memcpy(strings, s.args[i].zo_arg_value.zo_arg_char_str, n);
            args[i].zo_arg_value.zo_arg_char_str = strings;
            strings += n;
        }
    }
    rec->zo_error_id = s.id;
    rec->zo_ffdc_id = nullptr;
    rec->zo_msg_cat = cat;
    rec->zo_msg_set = s.msg_set;
    rec->zo_msg_num = s.msg_num;
    rec->zo_msg_default = text;
    rec->zo_arg_cnt = s.argc;
    rec->zo_args = s.argc ? args : nullptr;
    *record = rec;
    return 0;
}

int zo_pset_error_1(const zo_error_t *record) {
    if (!record) return zo_set_no_error_1();
    error_slot &s = t_slot;
    // The record may point into the slot itself only if a caller fabricated
    // it from one; copying through the slot's setters is safe either way
    // because every source is read before the slot is reset below.
    error_slot tmp;
    slot_begin(tmp, record->zo_error_id, record->zo_msg_cat, record->zo_msg_set, record->zo_msg_num,
               record->zo_msg_default);
    unsigned n = record->zo_arg_cnt < kMaxPositions ? record->zo_arg_cnt : kMaxPositions;
    for (unsigned i = 0; i < n && record->zo_args; ++i) store_arg(tmp, i + 1, record->zo_args[i]);
    tmp.argc = n;
    s = tmp;
    // The copied string pointers must point into the slot, not into tmp.
    for (unsigned i = 0; i < s.argc; ++i)
        if (s.args[i].zo_arg_type == ZO_ERROR_ARG_CHAR_STR)
            s.args[i].zo_arg_value.zo_arg_char_str = s.strings + (tmp.args[i].zo_arg_value.zo_arg_char_str - tmp.strings);
    return 0;
}

int zo_get_errmsg_1(const zo_error_t *record, char **text) {
    if (!text) return 4;
    *text = nullptr;
    if (!record) return 4;
    try {
        const char *tmpl = catalog_text(record->zo_msg_cat, record->zo_msg_set, record->zo_msg_num);
        if (!tmpl) tmpl = record->zo_msg_default ? record->zo_msg_default : "";
        std::string s = format_record(tmpl, *record);
        char *out = static_cast<char *>(std::malloc(s.size() + 1));
        if (!out) return 6;
        std::memcpy(out, s.c_str(), s.size() + 1);
        *text = out;
        return 0;
    } catch (...) {
        return 6;
    }
}

void zo_rel_error_1(zo_error_t *record) { std::free(record); }

void zo_rel_errmsg_1(char *text) { std::free(text); }

}  // extern "C"
