// Error records: the per-thread error slot, copies of it, and formatting a
// record through the message catalog with positional placeholders.
#include <dlfcn.h>
#include <limits.h>
#include <link.h>
#include <locale.h>
#include <nl_types.h>
#include <pthread.h>

#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "ry_zo.h"
#include "ry_zo_int.h"

namespace {

constexpr unsigned kMaxPositions = 16;   // messages use at most 6
constexpr size_t kTextCap = 4096;        // longest default text is ~1.1 KiB
constexpr size_t kStringCap = 16384;     // room for a few full paths
constexpr size_t kCatCap = 256;
constexpr size_t kSpareMsgCap = 8192;    // a default text and its arguments
constexpr int kMaxWidth = 4096;          // bound on widths a catalog may ask for

// The slot holds everything inline: recording an error never allocates, so
// it works when memory is exhausted (the very failure it often reports).
// The catalog name and default text are referred to where they have static
// storage (the library's own table) and copied only for other callers.  No
// member has an initialiser: the slot is zero-initialised thread storage,
// reached without a guard on every access.
struct error_slot {
    bool set;
    int32_t id;
    int32_t msg_set;
    int32_t msg_num;
    uint32_t argc;  // the highest position in use; args past it are stale
    const char *cat;
    const char *text;
    zo_error_arg_t args[kMaxPositions];
    size_t strings_used;
    char strings[kStringCap];
    char cat_copy[kCatCap];
    char text_copy[kTextCap];
    // What the report sequence hands out when a copy cannot be allocated.
    zo_error_t spare_rec;
    char spare_msg[kSpareMsgCap];
};

thread_local error_slot t_slot;

// The copies handed to callers; a test can make them fail.
std::atomic<bool (*)(size_t)> g_alloc_hook{nullptr};

void *zo_malloc(size_t n) {
    bool (*hook)(size_t) = g_alloc_hook.load(std::memory_order_acquire);
    if (hook && !hook(n)) return nullptr;
    return std::malloc(n);
}

void copy_bounded(char *dst, size_t cap, const char *src) {
    if (!src) src = "";
    size_t n = std::strlen(src);
    if (n >= cap) n = cap - 1;
    std::memmove(dst, src, n);  // a record made from the slot may be put back
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
    std::memmove(dst, src, n);
    dst[n] = '\0';
    s.strings_used += n + 1;
    return dst;
}

// One placeholder "%N$[flags][width][.prec][length]conv".
struct placeholder {
    size_t end = 0;             // one past the conversion character
    unsigned pos = 0;           // 1-based position
    char directive[32] = {};    // "%" flags width prec, without "N$", length or conv
    char conv = 0;
    int length = 0;             // 0 none, 1 'l', 2 "ll", -1 'h'
    int width = 0;
    int prec = -1;
    bool left = false;
};

bool parse_placeholder(std::string_view t, size_t i, placeholder &ph) {
    // t[i] == '%'
    size_t j = i + 1;
    unsigned pos = 0;
    size_t digits = 0;
    while (j < t.size() && t[j] >= '0' && t[j] <= '9' && digits < 4) pos = pos * 10 + (t[j++] - '0'), ++digits;
    if (digits == 0 || pos == 0 || j >= t.size() || t[j] != '$') return false;
    ++j;
    size_t d = 0;
    ph.directive[d++] = '%';
    // Each flag once is all a conversion can use; repeats are dropped.
    while (j < t.size() && t[j] && std::strchr("-+ #0", t[j])) {
        if (!std::memchr(ph.directive, t[j], d)) ph.directive[d++] = t[j];
        if (t[j] == '-') ph.left = true;
        ++j;
    }
    int width = 0;
    while (j < t.size() && t[j] >= '0' && t[j] <= '9') {
        width = width * 10 + (t[j] - '0');
        if (width > kMaxWidth) width = kMaxWidth;
        ++j;
    }
    if (width) d += static_cast<size_t>(std::snprintf(ph.directive + d, sizeof ph.directive - d, "%d", width));
    ph.width = width;
    if (j < t.size() && t[j] == '.') {
        ++j;
        int prec = 0;
        while (j < t.size() && t[j] >= '0' && t[j] <= '9') {
            prec = prec * 10 + (t[j] - '0');
            if (prec > kMaxWidth) prec = kMaxWidth;
            ++j;
        }
        d += static_cast<size_t>(std::snprintf(ph.directive + d, sizeof ph.directive - d, ".%d", prec));
        ph.prec = prec;
    }
    int length = 0;
    if (j < t.size() && t[j] == 'h') length = -1, ++j;
    else if (j + 1 < t.size() && t[j] == 'l' && t[j + 1] == 'l') length = 2, j += 2;
    else if (j < t.size() && t[j] == 'l') length = 1, ++j;
    if (j >= t.size() || !t[j] || !std::strchr("sdiuxXcfgeEp", t[j])) return false;
    ph.conv = t[j];
    ph.end = j + 1;
    ph.pos = pos;
    ph.length = length;
    return true;
}

// Kind and presence of each position a text uses.
struct positions {
    char conv[kMaxPositions + 1] = {};
    int length[kMaxPositions + 1] = {};
    unsigned highest = 0;
};

positions scan_positions(const char *text) {
    positions p;
    if (!text) return p;
    const std::string_view t(text);
    for (size_t i = t.find('%'); i != std::string_view::npos; i = t.find('%', i + 1)) {
        if (i + 1 < t.size() && t[i + 1] == '%') { ++i; continue; }
        placeholder ph;
        if (!parse_placeholder(t, i, ph)) continue;
        i = ph.end - 1;
        if (ph.pos > kMaxPositions) continue;
        if (!p.conv[ph.pos]) p.conv[ph.pos] = ph.conv, p.length[ph.pos] = ph.length;
        if (ph.pos > p.highest) p.highest = ph.pos;
    }
    return p;
}

void slot_begin(error_slot &s, int error_id, int msg_set, int msg_num, unsigned highest) {
    s.set = true;
    s.id = error_id;
    s.msg_set = msg_set;
    s.msg_num = msg_num;
    s.strings_used = 0;
    s.argc = highest;
    for (unsigned i = 0; i < highest; ++i) {
        s.args[i].zo_arg_type = ZO_ERROR_ARG_RESERVED;
        s.args[i].zo_arg_value.zo_arg_long_long = 0;
    }
}

void slot_copy_texts(error_slot &s, const char *msg_cat, const char *msg_default) {
    copy_bounded(s.cat_copy, kCatCap, msg_cat);
    copy_bounded(s.text_copy, kTextCap, msg_default);
    s.cat = s.cat_copy;
    s.text = s.text_copy;
}

void store_arg(error_slot &s, unsigned pos, const zo_error_arg_t &a) {
    zo_error_arg_t &d = s.args[pos - 1];
    d = a;
    if (a.zo_arg_type == ZO_ERROR_ARG_CHAR_STR) d.zo_arg_value.zo_arg_char_str = slot_string(s, a.zo_arg_value.zo_arg_char_str);
}

// The values of an array, one per used position in ascending order.
void store_argv(error_slot &s, uint32_t used, unsigned argc, const zo_error_arg_t *argv) {
    unsigned next = 0;
    for (unsigned pos = 1; pos <= s.argc; ++pos) {
        if (!(used & (1u << (pos - 1)))) continue;
        if (next < argc && argv) store_arg(s, pos, argv[next]);
        ++next;
    }
}

// ---- Catalog lookup ------------------------------------------------------

struct open_catalog {
    std::string name;
    std::string locale;
    nl_catd catd;
};
pthread_mutex_t g_cat_mutex = PTHREAD_MUTEX_INITIALIZER;
std::vector<open_catalog> *g_catalogs = nullptr;  // lives for the process
const nl_catd kNoCatalog = reinterpret_cast<nl_catd>(-1);

// The directory of a file, symbolic links resolved; empty unless the name is
// absolute, so nothing is ever looked up relative to the working directory.
std::string real_dir(const char *file) {
    if (!file || file[0] != '/') return {};
    char real[PATH_MAX];
    if (!realpath(file, real)) return {};
    std::string p = real;
    return p.substr(0, p.rfind('/'));
}

// Where the program and the library this code is in really are: an
// installed tree finds <prefix>/share/ryacl/ from <prefix>/bin or
// <prefix>/lib however the command was started (through PATH, a link, a
// relative name).  The program's own name as invoked says nothing of that.
std::vector<std::string> image_dirs() {
    std::vector<std::string> dirs;
    std::string exe = real_dir("/proc/self/exe");
    if (!exe.empty()) dirs.push_back(exe);
    Dl_info info{};
    struct link_map *map = nullptr;
    // The main program's entry has an empty name: it is /proc/self/exe.
    if (dladdr1(reinterpret_cast<void *>(&zo_get_errmsg_1), &info, reinterpret_cast<void **>(&map),
                RTLD_DL_LINKMAP) && map && map->l_name && map->l_name[0]) {
        std::string lib = real_dir(map->l_name);
        if (!lib.empty() && lib != exe) dirs.push_back(lib);
        // A library in a multiarch directory (<prefix>/lib/<triplet>) has
        // the tree's share/ two levels up: look from <prefix>/lib too.
        const size_t slash = lib.rfind('/');
        if (slash != std::string::npos && slash >= 4 && lib.compare(slash - 4, 4, "/lib") == 0)
            dirs.push_back(lib.substr(0, slash));
    }
    return dirs;
}

nl_catd try_open(const std::string &path) { return catopen(path.c_str(), NL_CAT_LOCALE); }

// Search order: the translations installed beside the program and the
// library (share/ryacl/nls/<locale>/NAME, then .../<language>/NAME); then
// NLSPATH and the system's default path, as catopen has them; last the
// English catalog share/ryacl/NAME beside them.
nl_catd find_catalog(const std::string &name, const std::string &locale) {
    if (name.find('/') != std::string::npos) return try_open(name);
    const std::vector<std::string> dirs = image_dirs();
    if (!locale.empty() && locale != "C" && locale != "POSIX") {
        const std::string lang = locale.substr(0, locale.find_first_of("_.@"));
        for (const auto &dir : dirs)
            for (const std::string &sub : {locale, lang}) {
                nl_catd c = try_open(dir + "/../share/ryacl/nls/" + sub + "/" + name);
                if (c != kNoCatalog) return c;
            }
    }
    nl_catd c = catopen(name.c_str(), NL_CAT_LOCALE);
    if (c != kNoCatalog) return c;
    for (const auto &dir : dirs) {
        c = try_open(dir + "/../share/ryacl/" + name);
        if (c != kNoCatalog) return c;
    }
    return kNoCatalog;
}

// The catalog's text for (set, num), or null.  Catalogs are opened once per
// name and locale and kept open.
const char *catalog_text(const char *cat, int set, int num) {
    if (!cat || !*cat) return nullptr;
    const char *result = nullptr;
    pthread_mutex_lock(&g_cat_mutex);
    try {
        const char *loc = setlocale(LC_MESSAGES, nullptr);
        std::string locale = loc ? loc : "C";
        if (!g_catalogs) g_catalogs = new std::vector<open_catalog>();
        nl_catd catd = kNoCatalog;
        bool found = false;
        for (const auto &c : *g_catalogs) {
            if (c.name == cat && c.locale == locale) { catd = c.catd; found = true; break; }
        }
        if (!found) {
            catd = find_catalog(cat, locale);
            g_catalogs->push_back({cat, locale, catd});
        }
        if (catd != kNoCatalog) {
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

// Where formatted text goes: a block of `cap` bytes (NUL included), or, with
// no block, nowhere, to learn the length.  `len` counts everything offered,
// so a second pass into a block of len + 1 bytes holds it all.
struct sink {
    char *buf;
    size_t cap;
    size_t len;

    void put(const char *p, size_t n) {
        if (buf && len + 1 < cap) std::memcpy(buf + len, p, n < cap - 1 - len ? n : cap - 1 - len);
        len += n;
    }
    void pad(size_t n) {
        while (n--) put(" ", 1);
    }
    void print(const char *fmt, ...) {
        va_list ap;
        va_start(ap, fmt);
        char *dst = buf && len < cap ? buf + len : nullptr;
        int n = std::vsnprintf(dst, dst ? cap - len : 0, fmt, ap);
        va_end(ap);
        if (n > 0) len += static_cast<size_t>(n);
    }
    void finish() {
        if (buf && cap) buf[len < cap ? len : cap - 1] = '\0';
    }
};

// A byte that came from a file is shown as \xNN when it would drive a
// terminal.
void put_escaped(sink &out, unsigned char c) {
    char esc[5];
    std::snprintf(esc, sizeof esc, "\\x%02x", c);
    out.put(esc, 4);
}

// A text argument.  One with control characters is written escaped, with
// the placeholder's width and precision counted in the escaped form.
void put_text(sink &out, const placeholder &ph, const char *s) {
    const std::string_view v(s);
    if (!zo::has_controls(v)) {
        char fmt[40];
        std::snprintf(fmt, sizeof fmt, "%ss", ph.directive);
        out.print(fmt, s);
        return;
    }
    size_t shown = 0;
    for (unsigned char c : v) shown += zo::is_control(c) ? 4 : 1;
    if (ph.prec >= 0 && shown > static_cast<size_t>(ph.prec)) shown = static_cast<size_t>(ph.prec);
    const size_t fill = static_cast<size_t>(ph.width) > shown ? static_cast<size_t>(ph.width) - shown : 0;
    if (!ph.left) out.pad(fill);
    size_t left = shown;
    for (unsigned char c : v) {
        const size_t w = zo::is_control(c) ? 4 : 1;
        if (w > left) break;
        if (w == 4) put_escaped(out, c);
        else out.put(reinterpret_cast<const char *>(&c), 1);
        left -= w;
    }
    if (ph.left) out.pad(fill);
}

void put_arg(sink &out, const placeholder &ph, const zo_error_t &rec) {
    if (ph.pos > rec.zo_arg_cnt || !rec.zo_args) return;  // never passed: nothing
    const zo_error_arg_t &a = rec.zo_args[ph.pos - 1];
    char fmt[40];
    switch (a.zo_arg_type) {
    case ZO_ERROR_ARG_CHAR_STR: {
        const char *s = a.zo_arg_value.zo_arg_char_str ? a.zo_arg_value.zo_arg_char_str : "";
        if (ph.conv == 's') return put_text(out, ph, s);
        placeholder plain;  // a text where a number was expected: show the text
        plain.directive[0] = '%';
        return put_text(out, plain, s);
    }
    case ZO_ERROR_ARG_INT:
    case ZO_ERROR_ARG_LONG:
    case ZO_ERROR_ARG_LONG_LONG: {
        long long v = a.zo_arg_type == ZO_ERROR_ARG_INT    ? a.zo_arg_value.zo_arg_int
                      : a.zo_arg_type == ZO_ERROR_ARG_LONG ? a.zo_arg_value.zo_arg_long
                                                           : a.zo_arg_value.zo_arg_long_long;
        if (ph.conv == 'c') {
            const auto c = static_cast<unsigned char>(v);
            if (zo::is_control(c)) return put_escaped(out, c);
            std::snprintf(fmt, sizeof fmt, "%sc", ph.directive);
            out.print(fmt, static_cast<int>(c));
        } else if (std::strchr("dixXu", ph.conv)) {
            // The value keeps the width it was recorded with: an int printed
            // with "%x" shows its 32 bits, not a sign-extended 64.
            if (a.zo_arg_type == ZO_ERROR_ARG_INT) {
                std::snprintf(fmt, sizeof fmt, "%s%c", ph.directive, ph.conv);
                out.print(fmt, static_cast<int>(v));
            } else {
                std::snprintf(fmt, sizeof fmt, "%sll%c", ph.directive, ph.conv);
                out.print(fmt, v);
            }
        } else {
            out.print("%lld", v);
        }
        return;
    }
    case ZO_ERROR_ARG_DOUBLE:
        if (std::strchr("fgeE", ph.conv)) {
            std::snprintf(fmt, sizeof fmt, "%s%c", ph.directive, ph.conv);
            out.print(fmt, a.zo_arg_value.zo_arg_double);
        } else {
            out.print("%g", a.zo_arg_value.zo_arg_double);
        }
        return;
    case ZO_ERROR_ARG_VOID_PTR:
        out.print("%p", a.zo_arg_value.zo_arg_void_ptr);
        return;
    default:
        return;  // a skipped position has no value
    }
}

// Allocates nothing: the out-of-memory report goes through here too.
void format_record(sink &out, const char *tmpl, const zo_error_t &rec) {
    const std::string_view t(tmpl);
    size_t last = 0;
    for (size_t i = t.find('%'); i != std::string_view::npos; i = t.find('%', i + 1)) {
        if (i + 1 < t.size() && t[i + 1] == '%') {
            out.put(t.data() + last, i - last);
            out.put("%", 1);
            last = i + 2;
            ++i;
            continue;
        }
        placeholder ph;
        if (!parse_placeholder(t, i, ph)) continue;  // a lone '%' stays as it is
        out.put(t.data() + last, i - last);
        put_arg(out, ph, rec);
        last = ph.end;
        i = ph.end - 1;
    }
    out.put(t.data() + last, t.size() - last);
}

}  // namespace

void zo::set_alloc_hook(bool (*hook)(size_t n)) { g_alloc_hook.store(hook, std::memory_order_release); }

zo::arg_positions zo::scan_arg_positions(const char *text) {
    const positions p = scan_positions(text);
    arg_positions r{0, p.highest};
    for (unsigned pos = 1; pos <= p.highest; ++pos)
        if (p.conv[pos]) r.used |= 1u << (pos - 1);
    return r;
}

void zo::set_error_static(int error_id, const char *msg_cat, int msg_set, int msg_num, const char *msg_default,
                          arg_positions where, unsigned argc, const zo_error_arg_t *argv) {
    error_slot &s = t_slot;
    slot_begin(s, error_id, msg_set, msg_num, where.highest);
    s.cat = msg_cat;
    s.text = msg_default;
    store_argv(s, where.used, argc, argv);
}

extern "C" {

int zo_set_error_1(int error_id, const char *ffdc_id, const char *msg_cat, int msg_set, int msg_num,
                   const char *msg_default, ...) {
    (void)ffdc_id;  // first-failure data is not kept by this layer
    error_slot &s = t_slot;
    slot_copy_texts(s, msg_cat, msg_default);
    const positions p = scan_positions(s.text);
    slot_begin(s, error_id, msg_set, msg_num, p.highest);
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
    return 0;
}

int zo_set_error_argv_1(int error_id, const char *ffdc_id, const char *msg_cat, int msg_set,
                        int msg_num, const char *msg_default, unsigned argc,
                        const zo_error_arg_t *argv) {
    (void)ffdc_id;
    error_slot &s = t_slot;
    slot_copy_texts(s, msg_cat, msg_default);
    const zo::arg_positions where = zo::scan_arg_positions(s.text);
    slot_begin(s, error_id, msg_set, msg_num, where.highest);
    store_argv(s, where.used, argc, argv);
    return 0;
}

int zo_set_no_error_1(void) {
    t_slot.set = false;
    return 0;
}

int zo_get_error_1(zo_error_t **record) {
    if (!record) return 4;
    *record = nullptr;
    error_slot &s = t_slot;
    if (!s.set) return 0;
    // One block: the record, its arguments, then every text.
    size_t textlen = std::strlen(s.text) + 1, catlen = std::strlen(s.cat) + 1;
    size_t size = sizeof(zo_error_t) + sizeof(zo_error_arg_t) * s.argc + textlen + catlen;
    for (unsigned i = 0; i < s.argc; ++i)
        if (s.args[i].zo_arg_type == ZO_ERROR_ARG_CHAR_STR) size += std::strlen(s.args[i].zo_arg_value.zo_arg_char_str) + 1;
    auto *block = static_cast<unsigned char *>(zo_malloc(size));
    if (!block) {
        // The report must still get through: a record that refers to the
        // slot itself, valid while the slot stays as it is.
        zo_error_t &r = s.spare_rec;
        r = zo_error_t{s.id, nullptr, const_cast<char *>(s.cat), s.msg_set, s.msg_num, const_cast<char *>(s.text),
                       s.argc, s.argc ? s.args : nullptr};
        *record = &r;
        return 6;
    }
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
    // The spare record is the slot itself: it is current already.
    if (record == &t_slot.spare_rec) return 0;
    // Every source is read into a scratch copy before the slot changes, so
    // a record made from the slot's own storage restores intact.
    struct scratch {
        char cat[kCatCap];
        char text[kTextCap];
        zo_error_arg_t args[kMaxPositions];
        char strings[kStringCap];
    };
    scratch storage;  // on the stack: restoring must work out of memory too
    scratch *tmp = &storage;
    copy_bounded(tmp->cat, kCatCap, record->zo_msg_cat);
    copy_bounded(tmp->text, kTextCap, record->zo_msg_default);
    const unsigned n = record->zo_args ? (record->zo_arg_cnt < kMaxPositions ? record->zo_arg_cnt : kMaxPositions) : 0;
    size_t used = 0;
    for (unsigned i = 0; i < n; ++i) {
        tmp->args[i] = record->zo_args[i];
        if (tmp->args[i].zo_arg_type != ZO_ERROR_ARG_CHAR_STR) continue;
        const char *src = tmp->args[i].zo_arg_value.zo_arg_char_str ? tmp->args[i].zo_arg_value.zo_arg_char_str : "";
        const size_t room = kStringCap - used;
        size_t len = room ? std::strlen(src) : 0;
        if (room && len >= room) len = room - 1;
        char *dst = tmp->strings + (room ? used : kStringCap - 1);
        if (room) std::memcpy(dst, src, len), dst[len] = '\0', used += len + 1;
        else *dst = '\0';
        tmp->args[i].zo_arg_value.zo_arg_char_str = dst;
    }
    error_slot &s = t_slot;
    slot_copy_texts(s, tmp->cat, tmp->text);
    slot_begin(s, record->zo_error_id, record->zo_msg_set, record->zo_msg_num, n);
    for (unsigned i = 0; i < n; ++i) store_arg(s, i + 1, tmp->args[i]);
    return 0;
}

int zo_get_errmsg_1(const zo_error_t *record, char **text) {
    if (!text) return 4;
    *text = nullptr;
    if (!record) return 4;
    const char *deflt = record->zo_msg_default ? record->zo_msg_default : "";
    const char *tmpl = catalog_text(record->zo_msg_cat, record->zo_msg_set, record->zo_msg_num);
    if (!tmpl) tmpl = deflt;
    sink count{nullptr, 0, 0};
    format_record(count, tmpl, *record);
    char *out = static_cast<char *>(zo_malloc(count.len + 1));
    if (out) {
        sink s{out, count.len + 1, 0};
        format_record(s, tmpl, *record);
        s.finish();
        *text = out;
        return 0;
    }
    // Out of memory: the default text, formatted into this thread's spare
    // area, so the message that says so still reaches the user.
    error_slot &sl = t_slot;
    sink s{sl.spare_msg, kSpareMsgCap, 0};
    format_record(s, deflt, *record);
    s.finish();
    *text = sl.spare_msg;
    return 6;
}

void zo_rel_error_1(zo_error_t *record) {
    if (record != &t_slot.spare_rec) std::free(record);
}

void zo_rel_errmsg_1(char *text) {
    if (text != t_slot.spare_msg) std::free(text);
}

}  // extern "C"
