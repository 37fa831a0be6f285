// Internal part of the utility layer: the operations the ACL library calls
// besides the error records (locale-independent text, IPv6 text, counters,
// codeset conversion handles) and the trace facility the library registers
// with.  Not installed.
#pragma once

#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <string>
#include <string_view>

#include "ry_zo.h"

// ---- Locale-independent text (POSIX locale case folding) ----------------

// Compare with A-Z folded onto a-z; every other byte compares as an unsigned
// value.  The same order serves insertion, search and evaluation.
int zo_strcasecmp_posix_1(const char *a, const char *b);
int zo_strncasecmp_posix_1(const char *a, const char *b, size_t n);
int zo_tolower_posix_1(int c);

// The same folding for the hot paths (tree keys, evaluation walks).
namespace zo {

inline unsigned char fold(unsigned char c) {
    return (c >= 'A' && c <= 'Z') ? static_cast<unsigned char>(c + 32) : c;
}

// Fold the ASCII capitals of eight bytes at once.
inline uint64_t fold8(uint64_t x) {
    constexpr uint64_t k7f = 0x7f7f7f7f7f7f7f7full, k80 = 0x8080808080808080ull;
    const uint64_t low = x & k7f;
    const uint64_t ge_a = low + 0x3f3f3f3f3f3f3f3full;  // high bit: byte >= 'A'
    const uint64_t gt_z = low + 0x2525252525252525ull;  // high bit: byte > 'Z'
    return x | (((ge_a & ~gt_z & ~x) & k80) >> 2);
}

inline uint64_t load8(const char *p) {
    uint64_t v;
    std::memcpy(&v, p, 8);
    return v;
}

// zo_strcasecmp_posix_1's sign for texts whose lengths are known: a has a
// NUL at alen, b one at blen (b may hold an earlier one, as a hostile
// buffer can; the result is then still that of the byte-wise compare).
// Eight bytes at a time while they agree; nothing past either NUL is read.
inline int casecmp_len(const char *a, size_t alen, const char *b, size_t blen) {
    const size_t m = (alen < blen ? alen : blen) + 1;
    size_t i = 0;
    for (; i + 8 <= m; i += 8) {
        const uint64_t x = fold8(load8(a + i)) ^ fold8(load8(b + i));
        if (x) {
            // The lowest differing byte of a little-endian load is the first.
            if constexpr (std::endian::native == std::endian::little)
                i += static_cast<size_t>(std::countr_zero(x)) / 8;
            break;
        }
    }
    for (; i < m; ++i) {
        const unsigned char x = static_cast<unsigned char>(a[i]), y = static_cast<unsigned char>(b[i]);
        const int d = fold(x) - fold(y);
        if (d != 0 || x == '\0') return d;
    }
    return 0;
}

// Equality of n bytes under the same folding, eight at a time.
inline bool fold_eq(const char *a, const char *b, size_t n) {
    size_t i = 0;
    for (; i + 8 <= n; i += 8)
        if (fold8(load8(a + i)) != fold8(load8(b + i))) return false;
    for (; i < n; ++i)
        if (fold(static_cast<unsigned char>(a[i])) != fold(static_cast<unsigned char>(b[i]))) return false;
    return true;
}

// A 32-bit hash of n bytes that texts equal under the folding share; the
// seed keeps apart keys of different kinds (an entry type, say).
inline uint32_t fold_hash(const char *s, size_t n, uint64_t seed = 0) {
    uint64_t h = 0x9e3779b97f4a7c15ull ^ seed ^ n;
    size_t i = 0;
    for (; i + 8 <= n; i += 8) {
        h ^= fold8(load8(s + i));
        h *= 0xff51afd7ed558ccdull;
        h ^= h >> 29;
    }
    uint64_t tail = 0;
    if (i < n && n >= 8 && std::endian::native == std::endian::little) {
        // The last eight bytes in one load, the ones already hashed shifted
        // out: the same value as gathering the tail byte by byte.
        tail = fold8(load8(s + n - 8)) >> (8 * (8 - (n - i)));
    } else {
        for (unsigned sh = 0; i < n; ++i, sh += 8) tail |= uint64_t{fold(static_cast<unsigned char>(s[i]))} << sh;
    }
    h ^= tail;
    h *= 0xc4ceb9fe1a85ec53ull;
    h ^= h >> 32;
    h *= 0xff51afd7ed558ccdull;
    h ^= h >> 29;
    return static_cast<uint32_t>(h >> 32);
}

// Control characters (0x00 to 0x1f but tab, and 0x7f) written as \xNN, so
// bytes that came from a file never drive the terminal they are shown on.
// Printable text, UTF-8 included, is unchanged.
inline bool is_control(unsigned char c) { return (c < 0x20 && c != '\t') || c == 0x7f; }
bool has_controls(std::string_view s);
std::string escape_controls(std::string_view s);

// Test seam: when set, every copy of a record or message text this layer
// hands out first asks the hook; false makes that allocation fail.
void set_alloc_hook(bool (*hook)(size_t n));

// The placeholder positions a default text uses: bit p - 1 of `used` for
// position p, and the highest one.
struct arg_positions {
    uint32_t used;
    unsigned highest;
};
arg_positions scan_arg_positions(const char *text);

// zo_set_error_argv_1 for a catalog name and default text of static storage
// duration (the library's own table), whose positions the caller scanned
// once: they are referred to, not copied or parsed again, so recording an
// error costs little more than copying its arguments.
void set_error_static(int error_id, const char *msg_cat, int msg_set, int msg_num, const char *msg_default,
                      arg_positions where, unsigned argc, const zo_error_arg_t *argv);

}  // namespace zo

// Canonical text of a 16-byte IPv6 address into `dst` (at least 65 bytes).
// Equal addresses always give equal text.  Returns 0, or non-zero when dst
// is too small.
int zo_ipaddr_ntop_1(const unsigned char addr[16], char *dst, size_t dstlen);

// ---- Counters and time ---------------------------------------------------

struct zo_timeinfo {
    uint64_t timeinfo1;
    uint64_t timeinfo2;
};

// Fill the data that converts counter values to time.
int zo_get_procspeed_1(zo_timeinfo *ti);
// Read the 64-bit high-resolution counter.
int zo_get_ctr_1(uint64_t *ctr);
// Convert a counter value to seconds and nanoseconds.
int zo_cvt_time_1(uint64_t ctr, const zo_timeinfo *ti, uint64_t *sec, uint64_t *nsec);

// ---- Codeset conversion ---------------------------------------------------

struct zo_iconv_s;
typedef zo_iconv_s *zo_iconv_t;

#define ZO_ICONV_FROM_UTF8 0x01u
#define ZO_ICONV_UTF8_NOT_MODIFIED 0x08u
#define ZO_ICONV_UTF8_BMP_ONLY 0x20u

// Results of zo_iconv_str_1 besides 0.
#define ZO_ICONV_RC_NO_MEMORY 15
#define ZO_ICONV_RC_BAD_HANDLE 17
#define ZO_ICONV_RC_BAD_ARGS 20
#define ZO_ICONV_RC_INVALID 21

int zo_utf8_is_assumed_1(void);
int zo_utf8_is_not_modified_1(void);
int zo_utf8_is_limited_to_bmp_1(void);
// Open a conversion between `codeset` and UTF-8 in the direction flag 0x01
// selects.  *handle stays null on failure.
int zo_iconv_open_1(const char *codeset, uint32_t flags, zo_iconv_t *handle);
// Convert the whole input (length with its NUL).  With *out null and *outlen
// 0 the output is allocated (release with free); it is NUL-terminated
// after *outlen bytes.  Safe for concurrent callers on one handle.  When it
// returns ZO_ICONV_RC_NO_MEMORY, *outlen holds the size it could not get.
int zo_iconv_str_1(zo_iconv_t handle, uint32_t options, const char *in, size_t *inlen,
                   char **out, size_t *outlen);

// ---- Trace facility -----------------------------------------------------

typedef uint8_t tr_detail_level_t;

struct tr_category_description_t {
    uint32_t category_id;
    const char *category_name;
    uint32_t default_level_of_detail;
    uint32_t minimum_level_of_detail;
};

int tr_register_component_1(const char *component, tr_detail_level_t *levels,
                            const tr_category_description_t *categories, uint32_t count);
int tr_record_id_1(const char *component, uint32_t id);
// `count` items follow, each as (const void *address, size_t length).
int tr_record_data_1(const char *component, uint32_t id, uint32_t count, ...);
// The same with the items in an array, for callers that hold a list.
struct tr_item_t {
    const void *addr;
    size_t len;
};
int tr_record_datav_1(const char *component, uint32_t id, uint32_t count, const tr_item_t *items);
int tr_get_filename_1(char *name /* 257 bytes */);
int tr_get_size_1(int32_t *size);
int tr_unregister_component_1(const char *component);
