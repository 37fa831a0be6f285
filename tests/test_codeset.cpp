// Conversion between the local codeset and UTF-8.  The handles open once per
// process, so cases that need another codeset or other settings run in a
// fresh process (a death-test child re-executing this binary).
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <string>

#include "ry_zo_int.h"
#include "ryacl_test_support.h"
#include "ryacl_utils.h"
#include "ryacl_utils_codeset.h"

namespace {

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

TEST(Codeset, PosixLocaleAsciiRoundTripKeepsBytesAndLengths) {
    for (const std::string t : {"krb5", "User@Host.example", " !\"#~`{|}", ""}) {
        for (bool to : {true, false}) {
            converted c = convert(to, t);
            ASSERT_EQ(c.rc, 0) << t;
            EXPECT_EQ(c.text, std::string(t.c_str(), t.size() + 1));  // the NUL is converted and counted
        }
    }
}

TEST(Codeset, InvalidBytesGive130AndAConverterFaultGives23With91) {
    for (const auto &[to, text] : {std::pair{true, "ab\x80" "cd"}, {false, "caf\xc3\xa9"}, {false, "ab\xc3"}}) {
        converted c = convert(to, text);
        EXPECT_EQ(c.rc, 26) << text;
        EXPECT_EQ(rytest::error_msgnum(), 130);
        EXPECT_FALSE(c.out_set);
    }
    EXPECT_EQ(convert(true, "x", true).rc, 23);  // no input length: an argument fault (20)
    std::string text = rytest::error_text();
    EXPECT_EQ(rytest::error_msgnum(), 91);
    EXPECT_NE(text.find("security/ACL/lib/ryacl_utils"), std::string::npos) << text;
    EXPECT_NE(text.find("Error code: 20"), std::string::npos) << text;
}

TEST(Codeset, AllocationFailureGives89AndLeavesNothingAllocated) {
    ASSERT_EQ(convert(true, "open").rc, 0);  // open the handles outside the failures
    ASSERT_EQ(convert(false, "open").rc, 0);
    for (bool to : {true, false}) {
        long sites = rytest::for_each_alloc_failure(
            [&] { return convert(to, "mechanism").rc; },
            [&](int32_t rc, long nth) {
                EXPECT_EQ(rc, 6) << nth;
                EXPECT_EQ(rytest::error_msgnum(), 89);
                EXPECT_NE(rytest::error_text().find(to ? "acl__convert_to_utf8" : "acl__convert_from_utf8"),
                          std::string::npos);
            });
        EXPECT_GE(sites, 1);
    }
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

// Checks inside a child process report on stderr and through the exit status.
int g_child_failures = 0;
#define CHILD_CHECK(cond) \
    ((cond) ? void() : (std::fprintf(stderr, "line %d: %s\n", __LINE__, #cond), void(++g_child_failures)))

TEST(CodesetChild, HandleThatCannotOpenGives129OnEveryCallWhileTheOtherDirectionWorks) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(
        {
            acl__set_codeset_for_test(false, "NO-SUCH-CODESET-Q");
            for (int i = 0; i < 3; ++i) {
                converted c = convert(true, "abc");
                CHILD_CHECK(c.rc == 26 && !c.out_set && rytest::error_msgnum() == 129);
            }
            CHILD_CHECK(convert(false, "abc").text == std::string("abc", 4));
            std::_Exit(g_child_failures);
        },
        ::testing::ExitedWithCode(0), "");
}

}  // namespace
