// Locale-independent comparison, canonical IPv6 text, counters.
#include <arpa/inet.h>
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "ry_zo_int.h"

namespace {

int sign(int v) { return (v > 0) - (v < 0); }

TEST(PosixCaseCompare, TotalOrderConsistentWithTolowerAndNStopsAtN) {
    // Every byte pair behind an equal-folded prefix: the sign is that of the
    // folded bytes as unsigned values, and swapping the texts flips it.
    for (int a = 1; a < 256; ++a) {
        EXPECT_EQ(zo_tolower_posix_1(a), (a >= 'A' && a <= 'Z') ? a + 32 : a) << a;
        for (int b = 1; b < 256; ++b) {
            char x[3] = {'K', static_cast<char>(a), 0}, y[3] = {'k', static_cast<char>(b), 0};
            int want = sign(zo_tolower_posix_1(a) - zo_tolower_posix_1(b));
            ASSERT_TRUE(sign(zo_strcasecmp_posix_1(x, y)) == want && sign(zo_strcasecmp_posix_1(y, x)) == -want)
                << a << " " << b;
        }
    }
    EXPECT_LT(zo_strcasecmp_posix_1("ab", "ABC"), 0);
    EXPECT_EQ(zo_strncasecmp_posix_1("abcX", "ABCy", 3), 0);
    EXPECT_NE(zo_strncasecmp_posix_1("abcX", "ABCy", 4), 0);
    EXPECT_EQ(zo_strncasecmp_posix_1("x", "y", 0), 0);
    char a[4] = {'a', 'b', 0, 'Q'}, b[4] = {'A', 'B', 0, 'r'};  // bytes past the NUL differ
    EXPECT_EQ(zo_strncasecmp_posix_1(a, b, 4), 0);
    EXPECT_NE(zo_strncasecmp_posix_1("ab", "ABC", 3), 0);  // length + 1 reaches the NUL
}

TEST(Ipv6Text, CanonicalFormWithinTheArea) {
    struct { const char *in, *want; size_t area; } cases[] = {
        {"0:0:0:0:0:0:0:0", "::", 65},
        {"0:0:0:0:0:0:0:1", "::1", 65},
        {"1:0:0:0:0:0:0:0", "1::", 65},
        {"2001:0DB8:0:0:0:0:0:ABCD", "2001:db8::abcd", 65},
        {"1:0:0:2:0:0:0:3", "1:0:0:2::3", 65},    // the longer run wins
        {"1:0:0:2:0:0:3:4", "1::2:0:0:3:4", 65},  // tie: the leftmost run
        {"0:0:1:2:3:4:0:0", "::1:2:3:4:0:0", 65},
        {"1:0:2:3:4:5:6:7", "1:0:2:3:4:5:6:7", 65},  // one zero group is not compressed
        {"::FFFF:0102:0304", "::ffff:1.2.3.4", 65},
        {"::fffe:1.2.3.4", "::fffe:102:304", 65},  // not mapped: plain groups
        {"2001:db8::1", "2001:db8::1", 12},
        {"2001:db8::1", "", 11},  // needs 12 bytes: refused, nothing written
    };
    for (const auto &c : cases) {
        unsigned char addr[16];
        char out[65];
        std::memset(out, '#', sizeof out);
        ASSERT_EQ(inet_pton(AF_INET6, c.in, addr), 1) << c.in;
        int rc = zo_ipaddr_ntop_1(addr, out, c.area);
        EXPECT_TRUE(*c.want ? rc == 0 && std::string(out) == c.want : rc != 0 && out[0] == '#') << c.in;
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
