// The trace facility: components register their categories, get their
// detail levels from RYACL_TRACE, and record points as readable lines in
// one trace file.
//
// Nothing here allocates: a trace point must not disturb the allocation
// failure stepping of the tests, nor fail when memory is short.  Every entry
// point keeps errno as it found it and never touches the error slot.
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#include <atomic>
#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "ry_zo_int.h"

namespace {

constexpr size_t kMaxComponents = 8;
constexpr size_t kNameCap = 32;
constexpr size_t kFileNameCap = 257;
constexpr size_t kLineCap = 8192;
constexpr size_t kMaxTextShown = 1024;
constexpr size_t kMaxHexShown = 64;
constexpr uint32_t kMaxItems = 32;

// A slot's name is written once, under g_lock, before `active` is first
// set; afterwards it is only read, so lookups need no lock.
struct component_slot {
    std::atomic<bool> active{false};
    std::atomic<bool> claimed{false};
    char name[kNameCap] = {};
};

component_slot g_components[kMaxComponents];
pthread_mutex_t g_lock = PTHREAD_MUTEX_INITIALIZER;  // claims slots, opens the file

char g_file_name[kFileNameCap];
std::atomic<bool> g_file_name_set{false};
constexpr int kFdUnopened = -1, kFdFailed = -2;
std::atomic<int> g_fd{kFdUnopened};
std::atomic<uint64_t> g_bytes{0};

struct errno_keeper {
    int saved = errno;
    ~errno_keeper() { errno = saved; }
};

bool valid_name(const char *component) {
    return component && *component && std::strlen(component) < kNameCap;
}

component_slot *find_component(const char *component) {
    for (auto &c : g_components)
        if (c.claimed.load(std::memory_order_acquire) && std::strcmp(c.name, component) == 0) return &c;
    return nullptr;
}

bool is_active(const char *component) {
    if (!valid_name(component)) return false;
    component_slot *c = find_component(component);
    return c && c->active.load(std::memory_order_acquire);
}

// Fill the file name once.  A RYACL_TRACE_FILE too long for the 257-byte
// area is ignored in favour of the default.  Caller holds g_lock.
void settle_file_name_locked() {
    if (g_file_name_set.load(std::memory_order_relaxed)) return;
    const char *env = std::getenv("RYACL_TRACE_FILE");
    if (env && *env && std::strlen(env) < kFileNameCap)
        std::snprintf(g_file_name, sizeof g_file_name, "%s", env);
    else
        std::snprintf(g_file_name, sizeof g_file_name, "/tmp/ryacl-trace.%ld.log", static_cast<long>(getpid()));
    g_file_name_set.store(true, std::memory_order_release);
}

// Open the trace file at the first record, so a process that records
// nothing creates nothing.  A failed open is not retried.
int trace_fd() {
    int fd = g_fd.load(std::memory_order_acquire);
    if (fd != kFdUnopened) return fd;
    pthread_mutex_lock(&g_lock);
    fd = g_fd.load(std::memory_order_relaxed);
    if (fd == kFdUnopened) {
        const bool chosen = std::getenv("RYACL_TRACE_FILE") != nullptr;
        settle_file_name_locked();
        int flags = O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC;
        // The default name lies in a shared directory and is predictable:
        // refuse to follow a link someone else planted there.  A name the
        // user chose (even /dev/stderr, itself a link) is followed.
        if (!chosen) flags |= O_NOFOLLOW;
        fd = open(g_file_name, flags, 0600);
        if (fd < 0) fd = kFdFailed;
        g_fd.store(fd, std::memory_order_release);
    }
    pthread_mutex_unlock(&g_lock);
    return fd;
}

// Bounded line builder: appends stop at the capacity, keeping room for the
// newline.
struct line {
    char buf[kLineCap];
    size_t len = 0;
    bool full = false;

    size_t room() const { return kLineCap - 1 - len; }  // 1 kept for '\n'
    void add(const char *s, size_t n) {
        if (full) return;
        if (n > room()) n = room(), full = true;
        std::memcpy(buf + len, s, n);
        len += n;
    }
    void add(const char *s) { add(s, std::strlen(s)); }
    void addf(const char *fmt, ...) __attribute__((format(printf, 2, 3))) {
        if (full) return;
        va_list ap;
        va_start(ap, fmt);
        int n = std::vsnprintf(buf + len, room() + 1, fmt, ap);
        va_end(ap);
        if (n < 0) return;
        if (static_cast<size_t>(n) > room()) n = static_cast<int>(room()), full = true;
        len += static_cast<size_t>(n);
    }
};

const char kHex[] = "0123456789abcdef";

// A text is shown as a string when it ends at its NUL and holds no other NUL
// nor control bytes; bytes >= 0x80 are allowed (UTF-8) and escaped.
bool looks_like_text(const unsigned char *p, size_t n) {
    if (n == 0 || p[n - 1] != '\0') return false;
    for (size_t i = 0; i + 1 < n; ++i)
        if (p[i] < 0x20 || p[i] == 0x7f) return false;
    return true;
}

void add_text(line &l, const unsigned char *p, size_t n) {
    size_t shown = n - 1 < kMaxTextShown ? n - 1 : kMaxTextShown;
    l.add("\"");
    for (size_t i = 0; i < shown; ++i) {
        unsigned char c = p[i];
        if (c == '"' || c == '\\') {
            char e[2] = {'\\', static_cast<char>(c)};
            l.add(e, 2);
        } else if (c >= 0x80) {
            char e[4] = {'\\', 'x', kHex[c >> 4], kHex[c & 15]};
            l.add(e, 4);
        } else {
            char ch = static_cast<char>(c);
            l.add(&ch, 1);
        }
    }
    l.add("\"");
    if (shown < n - 1) l.add("...");
}

void add_item(line &l, const void *addr, size_t n) {
    l.add(" ");
    auto *p = static_cast<const unsigned char *>(addr);
    if (!p) {
        l.add("(null)");
        return;
    }
    if (looks_like_text(p, n)) {
        add_text(l, p, n);
        return;
    }
    if (n == 1 || n == 2 || n == 4 || n == 8) {
        uint64_t v = 0;
        if (n == 1) v = p[0];
        if (n == 2) { uint16_t x; std::memcpy(&x, p, 2); v = x; }
        if (n == 4) { uint32_t x; std::memcpy(&x, p, 4); v = x; }
        if (n == 8) std::memcpy(&v, p, 8);
        l.addf("%llu/0x%llx", static_cast<unsigned long long>(v), static_cast<unsigned long long>(v));
        return;
    }
    l.add("x:");
    size_t shown = n < kMaxHexShown ? n : kMaxHexShown;
    for (size_t i = 0; i < shown; ++i) {
        char e[2] = {kHex[p[i] >> 4], kHex[p[i] & 15]};
        l.add(e, 2);
    }
    if (shown < n) l.addf("...(%zu bytes)", n);
}

// One record is one line, written with a single write() on an O_APPEND
// descriptor so records of concurrent threads never interleave.
void emit(const char *component, uint32_t id, uint32_t count, const tr_item_t *items, uint32_t dropped) {
    int fd = trace_fd();
    if (fd < 0) return;
    line l;
    struct timespec ts;
    clock_gettime(CLOCK_REALTIME, &ts);
    struct tm tm;
    gmtime_r(&ts.tv_sec, &tm);
    l.addf("%04d-%02d-%02dT%02d:%02d:%02d.%06ldZ pid=%ld tid=%ld %s %u", tm.tm_year + 1900, tm.tm_mon + 1,
           tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec, static_cast<long>(ts.tv_nsec / 1000),
           static_cast<long>(getpid()), static_cast<long>(syscall(SYS_gettid)), component, id);
    for (uint32_t i = 0; i < count; ++i) add_item(l, items[i].addr, items[i].len);
    if (dropped) l.addf(" (+%u items)", dropped);
    if (l.full) {
        const char mark[] = " ...";
        std::memcpy(l.buf + l.len - (sizeof mark - 1), mark, sizeof mark - 1);
    }
    l.buf[l.len++] = '\n';
    ssize_t w = write(fd, l.buf, l.len);
    if (w > 0) g_bytes.fetch_add(static_cast<uint64_t>(w), std::memory_order_relaxed);
}

// Levels from RYACL_TRACE: comma-separated NAME=VALUE, NAME a category name
// (any letter case) or "all", VALUE decimal clamped to 0..255.  Malformed
// and unknown entries are ignored; later entries override earlier ones.
void apply_environment(tr_detail_level_t *levels, const tr_category_description_t *categories, uint32_t count) {
    const char *s = std::getenv("RYACL_TRACE");
    if (!s) return;
    while (*s) {
        const char *end = std::strchr(s, ',');
        size_t len = end ? static_cast<size_t>(end - s) : std::strlen(s);
        const char *eq = static_cast<const char *>(std::memchr(s, '=', len));
        if (eq && eq > s && eq + 1 < s + len) {
            size_t name_len = static_cast<size_t>(eq - s);
            unsigned value = 0;
            bool ok = true;
            for (const char *d = eq + 1; d < s + len; ++d) {
                if (*d < '0' || *d > '9') { ok = false; break; }
                value = value * 10 + static_cast<unsigned>(*d - '0');
                if (value > 255) value = 256;  // stays clamped however many digits follow
            }
            if (ok) {
                tr_detail_level_t v = static_cast<tr_detail_level_t>(value > 255 ? 255 : value);
                bool all = name_len == 3 && zo_strncasecmp_posix_1(s, "all", 3) == 0;
                for (uint32_t i = 0; i < count; ++i) {
                    const char *cn = categories[i].category_name;
                    if (categories[i].category_id >= count) continue;
                    if (all || (cn && std::strlen(cn) == name_len && zo_strncasecmp_posix_1(s, cn, name_len) == 0))
                        levels[categories[i].category_id] = v;
                }
            }
        }
        if (!end) break;
        s = end + 1;
    }
}

}  // namespace

// `levels` must hold `count` entries, indexed by category_id; a category
// whose id is out of that range is skipped.  A minimum level raises the
// level from the environment, never lowers it.
int tr_register_component_1(const char *component, tr_detail_level_t *levels,
                            const tr_category_description_t *categories, uint32_t count) {
    errno_keeper keep;
    if (!valid_name(component) || !levels || (!categories && count)) return 1;
    for (uint32_t i = 0; i < count; ++i) {
        uint32_t id = categories[i].category_id;
        if (id >= count) continue;
        uint32_t d = categories[i].default_level_of_detail;
        levels[id] = static_cast<tr_detail_level_t>(d > 255 ? 255 : d);
    }
    apply_environment(levels, categories, count);
    for (uint32_t i = 0; i < count; ++i) {
        uint32_t id = categories[i].category_id, m = categories[i].minimum_level_of_detail;
        if (id < count && levels[id] < m) levels[id] = static_cast<tr_detail_level_t>(m > 255 ? 255 : m);
    }

    pthread_mutex_lock(&g_lock);
    component_slot *c = find_component(component);
    if (!c) {
        for (auto &s : g_components) {
            if (s.claimed.load(std::memory_order_relaxed)) continue;
            std::snprintf(s.name, sizeof s.name, "%s", component);
            s.claimed.store(true, std::memory_order_release);
            c = &s;
            break;
        }
    }
    if (c) c->active.store(true, std::memory_order_release);
    pthread_mutex_unlock(&g_lock);
    return c ? 0 : 2;  // 2: no room for another component
}

int tr_unregister_component_1(const char *component) {
    errno_keeper keep;
    if (!valid_name(component)) return 1;
    component_slot *c = find_component(component);
    if (!c || !c->active.exchange(false, std::memory_order_acq_rel)) return 3;  // not registered
    return 0;
}

int tr_record_id_1(const char *component, uint32_t id) {
    errno_keeper keep;
    if (!is_active(component)) return 3;
    emit(component, id, 0, nullptr, 0);
    return 0;
}

int tr_record_datav_1(const char *component, uint32_t id, uint32_t count, const tr_item_t *items) {
    errno_keeper keep;
    if (!is_active(component)) return 3;
    if (count && !items) return 1;
    uint32_t shown = count < kMaxItems ? count : kMaxItems;
    emit(component, id, shown, items, count - shown);
    return 0;
}

int tr_record_data_1(const char *component, uint32_t id, uint32_t count, ...) {
    errno_keeper keep;
    if (!is_active(component)) return 3;
    tr_item_t items[kMaxItems];
    uint32_t shown = count < kMaxItems ? count : kMaxItems;
    va_list ap;
    va_start(ap, count);
    for (uint32_t i = 0; i < shown; ++i) {
        items[i].addr = va_arg(ap, const void *);
        items[i].len = va_arg(ap, size_t);
    }
    va_end(ap);
    emit(component, id, shown, items, count - shown);
    return 0;
}

int tr_get_filename_1(char *name) {
    errno_keeper keep;
    if (!name) return 1;
    if (!g_file_name_set.load(std::memory_order_acquire)) {
        pthread_mutex_lock(&g_lock);
        settle_file_name_locked();
        pthread_mutex_unlock(&g_lock);
    }
    std::memcpy(name, g_file_name, kFileNameCap);
    return 0;
}

// The size is the number of bytes this process wrote to the trace file.
int tr_get_size_1(int32_t *size) {
    if (!size) return 1;
    uint64_t b = g_bytes.load(std::memory_order_relaxed);
    *size = b > INT32_MAX ? INT32_MAX : static_cast<int32_t>(b);
    return 0;
}
