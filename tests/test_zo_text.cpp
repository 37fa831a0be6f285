// Locale-independent text utilities: case-insensitive comparison, canonical
// IPv6 text, counters, and conversion between the local codeset and UTF-8.
// (Allocation failures of conversions within entries, a conversion handle
// that failed to open: test_alloc_failures.)
#include <arpa/inet.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <cstring>
#include <string>

#include "ry_zo_int.h"
#include "ryacl_test_support.h"
#include "ryacl_utils.h"

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

struct converted {
    int32_t rc;
    std::string text;  // the result's counted bytes
    bool out_set;
};

converted convert(bool to, const std::string &s, bool drop_length = false) {
    size_t inlen = s.size() + 1, outlen = 0;
    char *out = nullptr;
    size_t *in = drop_length ? nullptr : &inlen;
    int32_t rc = to ? acl__convert_to_utf8(s.c_str(), in, &out, &outlen)
                    : acl__convert_from_utf8(s.c_str(), in, &out, &outlen);
    converted c{rc, out ? std::string(out, outlen) : std::string(), out != nullptr};
    std::free(out);
    return c;
}

// (Valid texts round trip: test_thread_trace_codeset.)
TEST(Codeset, InvalidBytesGive130AndNoLengthGives23) {
    for (const auto &[to, text] : {std::pair{true, "ab\x80" "cd"}, {false, "caf\xc3\xa9"}, {false, "ab\xc3"}}) {
        converted c = convert(to, text);
        EXPECT_TRUE(c.rc == 26 && rytest::error_msgnum() == 130 && !c.out_set) << text;
    }
    EXPECT_EQ(convert(true, "x", true).rc, 23);  // no input length: an argument fault (20)
    const std::string text = rytest::error_text();
    EXPECT_EQ(rytest::error_msgnum(), 91);
    EXPECT_TRUE(text.find("security/ACL/lib/ryacl_utils") != std::string::npos &&
                text.find("Error code: 20") != std::string::npos) << text;
}

TEST(Codeset, AllocationFailureAtAnyGrowthFreesWhatWasBuilt) {
    // ASCII to UCS-4 quadruples the size, so the output must grow; a failure
    // at any growth frees what was built (the sanitizer build checks leaks).
    static zo_iconv_t h = nullptr;  // handles are never closed; keep it reachable
    ASSERT_EQ(zo_iconv_open_1("UCS-4BE", ZO_ICONV_FROM_UTF8, &h), 0);
    const std::string in(100, 'a');
    auto run = [&] {
        size_t inlen = in.size() + 1, outlen = 0;
        char *out = nullptr;
        int rc = zo_iconv_str_1(h, 0, in.c_str(), &inlen, &out, &outlen);
        if (rc == 0 && (outlen != 4 * inlen || std::string(out + 396, 4) != std::string("\0\0\0a", 4))) rc = -1;
        std::free(out);
        return rc;
    };
    ASSERT_EQ(run(), 0);
    EXPECT_GE(rytest::for_each_alloc_failure(run, [](int32_t rc, long) { EXPECT_EQ(rc, ZO_ICONV_RC_NO_MEMORY); }), 2);
}

}  // namespace
