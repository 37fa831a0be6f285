// Locale-independent comparison, canonical IPv6 text, counters.
#include <arpa/inet.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "ry_zo_int.h"

namespace {

int sign(int v) { return (v > 0) - (v < 0); }

TEST(PosixCaseCompare, TotalOrderConsistentWithTolowerOnEveryBytePair) {
    // Single-byte texts cover every folding decision; pairs with a common
    // prefix check that comparison goes on past equal-folded bytes.
    for (int a = 1; a < 256; ++a) {
        for (int b = 1; b < 256; ++b) {
            char x[3] = {'K', static_cast<char>(a), 0}, y[3] = {'k', static_cast<char>(b), 0};
            int la = zo_tolower_posix_1(a), lb = zo_tolower_posix_1(b);
            int want = sign(la - lb);
            ASSERT_EQ(sign(zo_strcasecmp_posix_1(x, y)), want) << a << " " << b;
            ASSERT_EQ(sign(zo_strcasecmp_posix_1(y, x)), -want) << a << " " << b;
        }
    }
    // Only A-Z fold, whatever the locale would say about other bytes.
    for (int c = 0; c < 256; ++c) {
        int want = (c >= 'A' && c <= 'Z') ? c + 32 : c;
        EXPECT_EQ(zo_tolower_posix_1(c), want) << c;
    }
    EXPECT_EQ(zo_tolower_posix_1(-1), -1);  // EOF passes through
}

TEST(PosixCaseCompare, SortingIsTransitiveAndPrefixesComeFirst) {
    std::mt19937 rng(7);
    const char alphabet[] = "aAbBzZ_[`{\x7f\x80\xc3\xa9\xff";
    std::vector<std::string> words;
    for (int i = 0; i < 400; ++i) {
        std::string w;
        int n = static_cast<int>(rng() % 5);
        for (int k = 0; k < n; ++k) w += alphabet[rng() % (sizeof alphabet - 1)];
        words.push_back(w);
    }
    std::sort(words.begin(), words.end(), [](const std::string &a, const std::string &b) {
        return zo_strcasecmp_posix_1(a.c_str(), b.c_str()) < 0;
    });
    // In a sorted sequence of a total order, every earlier element is <= every later one.
    for (size_t i = 0; i < words.size(); ++i)
        for (size_t j = i + 1; j < words.size(); ++j)
            ASSERT_LE(zo_strcasecmp_posix_1(words[i].c_str(), words[j].c_str()), 0) << i << " " << j;
    EXPECT_LT(zo_strcasecmp_posix_1("ab", "ABC"), 0);
    EXPECT_GT(zo_strcasecmp_posix_1("abc", "AB"), 0);
    EXPECT_EQ(zo_strcasecmp_posix_1("", ""), 0);
    // '_' (0x5f) lies between 'Z' and 'a': folded, 'Z' compares as 'z', after it.
    EXPECT_GT(zo_strcasecmp_posix_1("Z", "_"), 0);
    EXPECT_GT(zo_strcasecmp_posix_1("a", "_"), 0);
    EXPECT_LT(zo_strcasecmp_posix_1("z", "\x80"), 0);  // high bytes are unsigned
}

TEST(PosixCaseCompare, NCompareStopsAtN) {
    EXPECT_EQ(zo_strncasecmp_posix_1("abcX", "ABCy", 3), 0);
    EXPECT_NE(zo_strncasecmp_posix_1("abcX", "ABCy", 4), 0);
    EXPECT_EQ(zo_strncasecmp_posix_1("x", "y", 0), 0);
    // A shorter text ends the comparison at its NUL even when n is larger,
    // and the bytes after the NUL are never read.
    char a[4] = {'a', 'b', 0, 'Q'}, b[4] = {'A', 'B', 0, 'r'};
    EXPECT_EQ(zo_strncasecmp_posix_1(a, b, 4), 0);
    EXPECT_LT(zo_strncasecmp_posix_1("ab", "abc", 10), 0);
    // Length + 1 includes the NUL, which tells "ab" from "abc".
    EXPECT_NE(zo_strncasecmp_posix_1("ab", "ABC", 3), 0);
}

std::string ntop(const std::string &in) {
    unsigned char a[16];
    if (inet_pton(AF_INET6, in.c_str(), a) != 1) return "<bad input>";
    char out[65];
    std::memset(out, '#', sizeof out);
    if (zo_ipaddr_ntop_1(a, out, sizeof out) != 0) return "<failed>";
    return out;
}

TEST(Ipv6Text, CanonicalFormOfTrickyInputs) {
    struct { const char *in, *want; } cases[] = {
        {"0:0:0:0:0:0:0:0", "::"},
        {"0:0:0:0:0:0:0:1", "::1"},
        {"1:0:0:0:0:0:0:0", "1::"},
        {"2001:DB8:0:0:0:0:0:ABCD", "2001:db8::abcd"},
        {"2001:0db8:0000:0000:0000:0000:0000:0001", "2001:db8::1"},
        {"1:0:0:2:0:0:0:3", "1:0:0:2::3"},  // the longer run wins
        {"1:0:0:2:0:0:3:4", "1::2:0:0:3:4"},  // tie: the leftmost run
        {"1:0:2:3:4:5:6:7", "1:0:2:3:4:5:6:7"},  // one zero group is not compressed
        {"0:1:2:3:4:5:6:0", "0:1:2:3:4:5:6:0"},
        {"0:0:1:2:3:4:0:0", "::1:2:3:4:0:0"},
        {"::ffff:1.2.3.4", "::ffff:1.2.3.4"},
        {"::FFFF:0102:0304", "::ffff:1.2.3.4"},
        {"::ffff:0:0", "::ffff:0.0.0.0"},
        {"::fffe:1.2.3.4", "::fffe:102:304"},  // not mapped: plain groups
        {"ffff:ffff:ffff:ffff:ffff:ffff:ffff:ffff", "ffff:ffff:ffff:ffff:ffff:ffff:ffff:ffff"},
    };
    for (const auto &c : cases) EXPECT_EQ(ntop(c.in), c.want) << c.in;
}

TEST(Ipv6Text, RoundTripsAndEqualAddressesGiveEqualText) {
    std::mt19937 rng(11);
    for (int i = 0; i < 2000; ++i) {
        unsigned char a[16];
        // Mostly zero groups, so runs and ties of every shape occur.
        for (int g = 0; g < 8; ++g) {
            unsigned v = (rng() % 3 == 0) ? static_cast<unsigned>(rng() & 0xffff) : 0;
            if (rng() % 16 == 0) v = 0xffff;
            a[2 * g] = static_cast<unsigned char>(v >> 8);
            a[2 * g + 1] = static_cast<unsigned char>(v);
        }
        char t1[65], t2[65];
        ASSERT_EQ(zo_ipaddr_ntop_1(a, t1, sizeof t1), 0);
        unsigned char back[16];
        ASSERT_EQ(inet_pton(AF_INET6, t1, back), 1) << t1;
        ASSERT_EQ(std::memcmp(a, back, 16), 0) << t1;
        // The text of the parsed-back address, and of the address given
        // in other spellings, is the same text.
        ASSERT_EQ(zo_ipaddr_ntop_1(back, t2, sizeof t2), 0);
        ASSERT_STREQ(t1, t2);
        ASSERT_EQ(std::string(t1).find_first_of("ABCDEF"), std::string::npos);
        ASSERT_EQ(std::string(t1).find(":::"), std::string::npos);
    }
}

TEST(Ipv6Text, RefusesAnAreaTooSmallAndWritesNothingOutside) {
    unsigned char a[16];
    ASSERT_EQ(inet_pton(AF_INET6, "2001:db8::1", a), 1);
    char out[16];
    std::memset(out, '#', sizeof out);
    EXPECT_NE(zo_ipaddr_ntop_1(a, out, 11), 0);  // "2001:db8::1" needs 12
    EXPECT_EQ(out[0], '#');
    EXPECT_EQ(zo_ipaddr_ntop_1(a, out, 12), 0);
    EXPECT_STREQ(out, "2001:db8::1");
    EXPECT_EQ(out[12], '#');
    EXPECT_NE(zo_ipaddr_ntop_1(nullptr, out, sizeof out), 0);
    EXPECT_NE(zo_ipaddr_ntop_1(a, nullptr, 65), 0);
}

TEST(Counters, MonotonicAndConvertedToSecondsAndNanoseconds) {
    zo_timeinfo ti{};
    ASSERT_EQ(zo_get_procspeed_1(&ti), 0);
    uint64_t c1 = 0, c2 = 0;
    ASSERT_EQ(zo_get_ctr_1(&c1), 0);
    ASSERT_EQ(zo_get_ctr_1(&c2), 0);
    EXPECT_GE(c2, c1);
    EXPECT_GT(c1, 0u);

    uint64_t s = 0, ns = 0;
    // 3.5 s worth of ticks, whatever the tick rate.
    ASSERT_EQ(zo_cvt_time_1(ti.timeinfo1 * 3 + ti.timeinfo1 / 2, &ti, &s, &ns), 0);
    EXPECT_EQ(s, 3u);
    EXPECT_EQ(ns, 500000000u);
    // A tick rate other than 1 GHz, and a counter near the top of 64 bits.
    zo_timeinfo odd{3000000000u, 0};
    ASSERT_EQ(zo_cvt_time_1(UINT64_MAX, &odd, &s, &ns), 0);
    EXPECT_EQ(s, UINT64_MAX / 3000000000u);
    EXPECT_EQ(ns, (UINT64_MAX % 3000000000u) / 3);
    EXPECT_LT(ns, 1000000000u);

    zo_timeinfo zero{0, 0};
    EXPECT_NE(zo_cvt_time_1(1, &zero, &s, &ns), 0);
    EXPECT_NE(zo_get_ctr_1(nullptr), 0);
}

}  // namespace
