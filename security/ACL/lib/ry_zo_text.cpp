// Locale-independent text operations, canonical IPv6 text and the
// high-resolution counter of the utility layer.
#include <time.h>

#include <cstdint>
#include <cstdio>
#include <cstring>

#include "ry_zo_int.h"

namespace {

constexpr uint64_t kNsPerSec = 1000000000u;

using zo::fold;

}  // namespace

// Folding happens byte by byte and nothing consults the locale, so the
// order is the same in every process and for every thread; bytes >= 0x80
// (UTF-8 sequences) order by their unsigned value.
int zo_strcasecmp_posix_1(const char *a, const char *b) {
    auto *p = reinterpret_cast<const unsigned char *>(a);
    auto *q = reinterpret_cast<const unsigned char *>(b);
    for (;; ++p, ++q) {
        int d = fold(*p) - fold(*q);
        if (d != 0 || *p == '\0') return d;
    }
}

int zo_strncasecmp_posix_1(const char *a, const char *b, size_t n) {
    auto *p = reinterpret_cast<const unsigned char *>(a);
    auto *q = reinterpret_cast<const unsigned char *>(b);
    for (; n > 0; --n, ++p, ++q) {
        int d = fold(*p) - fold(*q);
        if (d != 0 || *p == '\0') return d;
    }
    return 0;
}

int zo_tolower_posix_1(int c) {
    return (c >= 'A' && c <= 'Z') ? c - 'A' + 'a' : c;
}

bool zo::has_controls(std::string_view s) {
    for (unsigned char c : s)
        if (is_control(c)) return true;
    return false;
}

std::string zo::escape_controls(std::string_view s) {
    static constexpr char kHex[] = "0123456789abcdef";
    std::string out;
    out.reserve(s.size());
    for (unsigned char c : s) {
        if (!is_control(c)) {
            out.push_back(static_cast<char>(c));
            continue;
        }
        const char esc[4] = {'\\', 'x', kHex[c >> 4], kHex[c & 15]};
        out.append(esc, 4);
    }
    return out;
}

// RFC 5952 text: lower-case hex without leading zeros, the longest run of
// two or more zero groups as "::" (the leftmost on a tie), and the
// IPv4-mapped form ::ffff:a.b.c.d.  The longest result is 39 characters, so
// a 65-byte area always suffices; a smaller one must still hold the text.
int zo_ipaddr_ntop_1(const unsigned char addr[16], char *dst, size_t dstlen) {
    if (!addr || !dst) return 1;
    char text[65];
    size_t len = 0;
    uint16_t g[8];
    for (int i = 0; i < 8; ++i) g[i] = static_cast<uint16_t>(addr[2 * i] << 8 | addr[2 * i + 1]);

    bool mapped = g[0] == 0 && g[1] == 0 && g[2] == 0 && g[3] == 0 && g[4] == 0 && g[5] == 0xffff;
    if (mapped) {
        len = static_cast<size_t>(std::snprintf(text, sizeof text, "::ffff:%u.%u.%u.%u", addr[12], addr[13],
                                                addr[14], addr[15]));
    } else {
        int best = -1, best_len = 0;
        for (int i = 0; i < 8;) {
            if (g[i] != 0) { ++i; continue; }
            int j = i;
            while (j < 8 && g[j] == 0) ++j;
            if (j - i > best_len) best = i, best_len = j - i;  // strict: leftmost wins ties
            i = j;
        }
        if (best_len < 2) best = -1;  // a single zero group is written as "0"
        for (int i = 0; i < 8;) {
            if (i == best) {
                text[len++] = ':';
                if (i == 0) text[len++] = ':';
                i += best_len;
                continue;
            }
            len += static_cast<size_t>(std::snprintf(text + len, sizeof text - len, "%x", g[i]));
            if (++i < 8) text[len++] = ':';
        }
        text[len] = '\0';
    }
    if (len + 1 > dstlen) return 1;
    std::memcpy(dst, text, len + 1);
    return 0;
}

// The counter counts nanoseconds of CLOCK_MONOTONIC: steady across clock
// changes and cheap (vDSO), which is all the timing records need.
int zo_get_procspeed_1(zo_timeinfo *ti) {
    if (!ti) return 1;
    ti->timeinfo1 = kNsPerSec;  // counter ticks per second
    ti->timeinfo2 = 0;          // unused
    return 0;
}

int zo_get_ctr_1(uint64_t *ctr) {
    if (!ctr) return 1;
    struct timespec ts;
    if (clock_gettime(CLOCK_MONOTONIC, &ts) != 0) {
        *ctr = 0;
        return 1;
    }
    *ctr = static_cast<uint64_t>(ts.tv_sec) * kNsPerSec + static_cast<uint64_t>(ts.tv_nsec);
    return 0;
}

int zo_cvt_time_1(uint64_t ctr, const zo_timeinfo *ti, uint64_t *sec, uint64_t *nsec) {
    if (!ti || !sec || !nsec || ti->timeinfo1 == 0) return 1;
    const uint64_t tps = ti->timeinfo1;
    *sec = ctr / tps;
    // The remainder is below tps; widen so any tick rate converts exactly.
    __extension__ typedef unsigned __int128 u128;
    *nsec = static_cast<uint64_t>(static_cast<u128>(ctr % tps) * kNsPerSec / tps);
    return 0;
}
