// Locale-independent comparison, canonical IPv6 text, counters.
#include <arpa/inet.h>
#include <gtest/gtest.h>

#include <cstring>
#include <random>
#include <string>

#include "ry_zo_int.h"

namespace {

int sign(int v) { return (v > 0) - (v < 0); }

TEST(PosixCaseCompare, TotalOrderConsistentWithTolowerAndNStopsAtN) {
    // Every byte pair behind an equal-folded prefix: the sign is that of the
    // folded bytes as unsigned values, and swapping the texts flips it.
    for (int a = 1; a < 256; ++a) {
        for (int b = 1; b < 256; ++b) {
            char x[3] = {'K', static_cast<char>(a), 0}, y[3] = {'k', static_cast<char>(b), 0};
            int want = sign(zo_tolower_posix_1(a) - zo_tolower_posix_1(b));
            ASSERT_EQ(sign(zo_strcasecmp_posix_1(x, y)), want) << a << " " << b;
            ASSERT_EQ(sign(zo_strcasecmp_posix_1(y, x)), -want) << a << " " << b;
        }
    }
    for (int c = 0; c < 256; ++c) EXPECT_EQ(zo_tolower_posix_1(c), (c >= 'A' && c <= 'Z') ? c + 32 : c) << c;
    EXPECT_LT(zo_strcasecmp_posix_1("ab", "ABC"), 0);
    EXPECT_GT(zo_strcasecmp_posix_1("Z", "_"), 0);  // 'Z' compares as 'z', above '_'

    EXPECT_EQ(zo_strncasecmp_posix_1("abcX", "ABCy", 3), 0);
    EXPECT_NE(zo_strncasecmp_posix_1("abcX", "ABCy", 4), 0);
    EXPECT_EQ(zo_strncasecmp_posix_1("x", "y", 0), 0);
    char a[4] = {'a', 'b', 0, 'Q'}, b[4] = {'A', 'B', 0, 'r'};  // bytes past the NUL differ
    EXPECT_EQ(zo_strncasecmp_posix_1(a, b, 4), 0);
    EXPECT_NE(zo_strncasecmp_posix_1("ab", "ABC", 3), 0);  // length + 1 reaches the NUL
}

std::string ntop(const char *in, size_t area = 65) {
    unsigned char a[16];
    if (inet_pton(AF_INET6, in, a) != 1) return "<bad input>";
    char out[65];
    std::memset(out, '#', sizeof out);
    if (zo_ipaddr_ntop_1(a, out, area) != 0) return out[0] == '#' ? "<refused>" : "<wrote on failure>";
    return out;
}

TEST(Ipv6Text, CanonicalFormOfTrickyInputs) {
    struct { const char *in, *want; } cases[] = {
        {"0:0:0:0:0:0:0:0", "::"},
        {"0:0:0:0:0:0:0:1", "::1"},
        {"1:0:0:0:0:0:0:0", "1::"},
        {"2001:0DB8:0:0:0:0:0:ABCD", "2001:db8::abcd"},
        {"1:0:0:2:0:0:0:3", "1:0:0:2::3"},    // the longer run wins
        {"1:0:0:2:0:0:3:4", "1::2:0:0:3:4"},  // tie: the leftmost run
        {"0:0:1:2:3:4:0:0", "::1:2:3:4:0:0"},
        {"1:0:2:3:4:5:6:7", "1:0:2:3:4:5:6:7"},  // one zero group is not compressed
        {"::FFFF:0102:0304", "::ffff:1.2.3.4"},
        {"::fffe:1.2.3.4", "::fffe:102:304"},  // not mapped: plain groups
    };
    for (const auto &c : cases) EXPECT_EQ(ntop(c.in), c.want) << c.in;
    EXPECT_EQ(ntop("2001:db8::1", 11), "<refused>");  // needs 12 bytes
    EXPECT_EQ(ntop("2001:db8::1", 12), "2001:db8::1");
}

TEST(Ipv6Text, RoundTripsAndEqualAddressesGiveEqualText) {
    std::mt19937 rng(11);
    for (int i = 0; i < 2000; ++i) {
        unsigned char a[16], back[16];
        for (int g = 0; g < 8; ++g) {  // mostly zero groups: runs and ties of every shape
            unsigned v = rng() % 3 == 0 ? static_cast<unsigned>(rng() & 0xffff) : rng() % 16 == 0 ? 0xffff : 0;
            a[2 * g] = static_cast<unsigned char>(v >> 8);
            a[2 * g + 1] = static_cast<unsigned char>(v);
        }
        char t1[65], t2[65];
        ASSERT_EQ(zo_ipaddr_ntop_1(a, t1, sizeof t1), 0);
        ASSERT_TRUE(inet_pton(AF_INET6, t1, back) == 1 && std::memcmp(a, back, 16) == 0) << t1;
        ASSERT_EQ(zo_ipaddr_ntop_1(back, t2, sizeof t2), 0);
        ASSERT_STREQ(t1, t2);
    }
}

TEST(Counters, MonotonicAndConvertedExactly) {
    zo_timeinfo ti{}, odd{3000000000u, 0};  // odd: another tick rate, near the top of 64 bits
    uint64_t c1 = 0, c2 = 0, s = 0, ns = 0;
    ASSERT_EQ(zo_get_procspeed_1(&ti) | zo_get_ctr_1(&c1) | zo_get_ctr_1(&c2), 0);
    EXPECT_GE(c2, c1);
    ASSERT_EQ(zo_cvt_time_1(ti.timeinfo1 * 3 + ti.timeinfo1 / 2, &ti, &s, &ns), 0);
    EXPECT_TRUE(s == 3 && ns == 500000000u) << s << " " << ns;
    ASSERT_EQ(zo_cvt_time_1(UINT64_MAX, &odd, &s, &ns), 0);
    EXPECT_TRUE(s == UINT64_MAX / 3000000000u && ns == (UINT64_MAX % 3000000000u) / 3) << s << " " << ns;
}

}  // namespace
