// Conversion between the local codeset and UTF-8.  The handles open once per
// process, so cases that need another codeset or other settings run in a
// fresh process (a death-test child re-executing this binary).
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "ry_zo_int.h"
#include "ryacl_alloc.h"
#include "ryacl_test_support.h"
#include "ryacl_utils.h"
#include "ryacl_utils_codeset.h"

namespace {

struct converted {
    int32_t rc;
    std::string text;  // the bytes before the length, "" on failure
    size_t len;
    bool out_set;
};

converted to_utf8(const std::string &s) {
    size_t inlen = s.size() + 1, outlen = 0;
    char *out = nullptr;
    int32_t rc = acl__convert_to_utf8(s.c_str(), &inlen, &out, &outlen);
    converted c{rc, out ? std::string(out, outlen) : std::string(), outlen, out != nullptr};
    std::free(out);
    return c;
}

converted from_utf8(const std::string &s) {
    size_t inlen = s.size() + 1, outlen = 0;
    char *out = nullptr;
    int32_t rc = acl__convert_from_utf8(s.c_str(), &inlen, &out, &outlen);
    converted c{rc, out ? std::string(out, outlen) : std::string(), outlen, out != nullptr};
    std::free(out);
    return c;
}

// Checks inside a child process report on stderr and through the exit status.
int g_child_failures = 0;
#define CHILD_CHECK(cond)                                                              \
    do {                                                                               \
        if (!(cond)) {                                                                 \
            std::fprintf(stderr, "child check failed at line %d: %s\n", __LINE__, #cond); \
            ++g_child_failures;                                                        \
        }                                                                              \
    } while (0)

class CodesetChild : public ::testing::Test {
protected:
    void SetUp() override { GTEST_FLAG_SET(death_test_style, "threadsafe"); }
};

TEST(Codeset, PosixLocaleAsciiRoundTripKeepsBytesAndLengths) {
    const std::string texts[] = {"krb5", "User@Host.example", " !\"#$%&'()*+,-./09:;<=>?@AZ[\\]^_`az{|}~", ""};
    for (const std::string &t : texts) {
        converted u = to_utf8(t);
        ASSERT_EQ(u.rc, 0) << t;
        EXPECT_EQ(u.len, t.size() + 1);  // the NUL is converted and counted
        EXPECT_EQ(u.text, std::string(t.c_str(), t.size() + 1));
        converted l = from_utf8(t);
        ASSERT_EQ(l.rc, 0) << t;
        EXPECT_EQ(l.text, std::string(t.c_str(), t.size() + 1));
        EXPECT_EQ(rytest::error_code(), 0);
    }
}

TEST(Codeset, BytesInvalidInTheSourceGive130AndNoResult) {
    converted c = to_utf8("ab\x80" "cd");  // not ASCII
    EXPECT_EQ(c.rc, 26);
    EXPECT_EQ(rytest::error_msgnum(), 130);
    EXPECT_FALSE(c.out_set);
    EXPECT_EQ(c.len, 0u);
    EXPECT_NE(rytest::error_text().find("4471-143"), std::string::npos);

    EXPECT_EQ(from_utf8("caf\xc3\xa9").rc, 26);  // valid UTF-8, no ASCII form
    EXPECT_EQ(rytest::error_msgnum(), 130);
    EXPECT_EQ(from_utf8("\xff").rc, 26);  // not UTF-8 at all
    EXPECT_EQ(from_utf8("ab\xc3").rc, 26);  // a sequence cut short by the NUL
    EXPECT_EQ(rytest::error_msgnum(), 130);
    EXPECT_EQ(to_utf8("fine").rc, 0);  // the handle survives a failure
}

TEST(Codeset, InternalFaultOfTheConverterGives23With91AndTheCode) {
    char *out = nullptr;
    size_t outlen = 0;
    // A missing input length is an argument fault of the converter (20).
    EXPECT_EQ(acl__convert_to_utf8("x", nullptr, &out, &outlen), 23);
    EXPECT_EQ(rytest::error_msgnum(), 91);
    std::string text = rytest::error_text();
    EXPECT_NE(text.find("security/ACL/lib/ryacl_utils"), std::string::npos) << text;
    EXPECT_NE(text.find("Error code: 20"), std::string::npos) << text;
    EXPECT_EQ(out, nullptr);

    size_t inlen = 2;
    EXPECT_EQ(zo_iconv_str_1(nullptr, 0, "x", &inlen, &out, &outlen), ZO_ICONV_RC_BAD_HANDLE);
    static zo_iconv_t h = nullptr;  // handles are never closed; keep it reachable
    ASSERT_EQ(zo_iconv_open_1("UTF-8", 0, &h), 0);
    char area[8];
    out = area;  // a caller-sized area is refused
    EXPECT_EQ(zo_iconv_str_1(h, 0, "x", &inlen, &out, &outlen), ZO_ICONV_RC_BAD_ARGS);
    zo_iconv_t none = reinterpret_cast<zo_iconv_t>(&area);
    EXPECT_EQ(zo_iconv_open_1("NO-SUCH-CODESET-Q", 0, &none), ZO_ICONV_RC_INVALID);
    EXPECT_EQ(none, nullptr);
}

TEST(Codeset, AllocationFailureGives89AndLeavesNothingAllocated) {
    ASSERT_EQ(to_utf8("open").rc, 0);  // open the handles outside the failures
    ASSERT_EQ(from_utf8("open").rc, 0);
    const std::string in = "mechanism-and-identity";
    for (bool forward : {true, false}) {
        long sites = rytest::for_each_alloc_failure(
            [&] { return (forward ? to_utf8(in) : from_utf8(in)).rc; },
            [&](int32_t rc, long nth) {
                EXPECT_EQ(rc, 6) << nth;
                EXPECT_EQ(rytest::error_msgnum(), 89);
                EXPECT_NE(rytest::error_text().find(forward ? "acl__convert_to_utf8" : "acl__convert_from_utf8"),
                          std::string::npos);
            });
        EXPECT_GE(sites, 1);
    }
}

TEST(Codeset, OutputGrowsPastTheFirstGuessAndEveryGrowthCanFail) {
    // ASCII to UCS-4 quadruples the size: the output must grow, and a
    // failure at any step must free what was built.
    static zo_iconv_t h = nullptr;  // handles are never closed; keep it reachable
    ASSERT_EQ(zo_iconv_open_1("UCS-4BE", ZO_ICONV_FROM_UTF8, &h), 0);
    const std::string in(100, 'a');
    auto run = [&](std::string *res) {
        size_t inlen = in.size() + 1, outlen = 0;
        char *out = nullptr;
        int rc = zo_iconv_str_1(h, 0, in.c_str(), &inlen, &out, &outlen);
        if (rc == 0 && res) res->assign(out, outlen);
        if (rc != 0 && out) rc = -1;  // an output on failure is a fault
        std::free(out);
        return rc;
    };
    std::string res;
    ASSERT_EQ(run(&res), 0);
    ASSERT_EQ(res.size(), 4 * (in.size() + 1));
    EXPECT_EQ(res.substr(0, 4), std::string("\0\0\0a", 4));
    long sites = rytest::for_each_alloc_failure([&] { return run(nullptr); },
                                                [](int32_t rc, long nth) { EXPECT_EQ(rc, ZO_ICONV_RC_NO_MEMORY) << nth; });
    EXPECT_GE(sites, 2);  // the first block and at least one growth
}

TEST_F(CodesetChild, HandleThatCannotOpenGives129OnEveryCallWhileTheOtherDirectionWorks) {
    EXPECT_EXIT(
        {
            acl__set_codeset_for_test(false, "NO-SUCH-CODESET-Q");
            for (int i = 0; i < 3; ++i) {
                converted c = to_utf8("abc");
                CHILD_CHECK(c.rc == 26 && !c.out_set);
                CHILD_CHECK(rytest::error_msgnum() == 129);
            }
            CHILD_CHECK(rytest::error_text().find("4471-142") != std::string::npos);
            converted back = from_utf8("abc");
            CHILD_CHECK(back.rc == 0 && back.text == std::string("abc", 4));
            std::_Exit(g_child_failures);
        },
        ::testing::ExitedWithCode(0), "");
}

TEST_F(CodesetChild, Utf8AssumedConvertsUtf8AndStillRefusesInvalidBytes) {
    EXPECT_EXIT(
        {
            setenv("RYACL_UTF8_ASSUMED", "1", 1);
            CHILD_CHECK(zo_utf8_is_assumed_1());
            converted c = to_utf8("caf\xc3\xa9 \xf0\x9f\x98\x80");  // beyond the BMP is fine here
            CHILD_CHECK(c.rc == 0 && c.text == std::string("caf\xc3\xa9 \xf0\x9f\x98\x80", 11));
            CHILD_CHECK(to_utf8("\xff").rc == 26 && rytest::error_msgnum() == 130);
            CHILD_CHECK(to_utf8("\xed\xa0\x80").rc == 26);  // a surrogate is not UTF-8
            CHILD_CHECK(from_utf8("caf\xc3\xa9").rc == 0);
            std::_Exit(g_child_failures);
        },
        ::testing::ExitedWithCode(0), "");
}

TEST_F(CodesetChild, BmpOnlyRefusesCharactersBeyondTheBmpBothWays) {
    EXPECT_EXIT(
        {
            setenv("RYACL_UTF8_ASSUMED", "1", 1);
            setenv("RYACL_UTF8_BMP_ONLY", "1", 1);
            setenv("RYACL_UTF8_NOT_MODIFIED", "0", 1);
            CHILD_CHECK(!zo_utf8_is_not_modified_1());
            CHILD_CHECK(to_utf8("euro \xe2\x82\xac").rc == 0);
            CHILD_CHECK(to_utf8("smile \xf0\x9f\x98\x80").rc == 26 && rytest::error_msgnum() == 130);
            CHILD_CHECK(from_utf8("smile \xf0\x9f\x98\x80").rc == 26 && rytest::error_msgnum() == 130);
            CHILD_CHECK(from_utf8("euro \xe2\x82\xac").rc == 0);
            std::_Exit(g_child_failures);
        },
        ::testing::ExitedWithCode(0), "");
}

}  // namespace
