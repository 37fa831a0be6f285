// Conversion between the local codeset and UTF-8.  (A handle that failed to
// open staying absent: test_alloc_failures.)
#include <gtest/gtest.h>

#include <cstdlib>
#include <string>

#include "ry_zo_int.h"
#include "ryacl_test_support.h"
#include "ryacl_utils.h"

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

TEST(Codeset, AsciiRoundTripsAndInvalidBytesGive130) {
    for (const std::string t : {"krb5", "User@Host.example", " !\"#~`{|}", ""})
        for (bool to : {true, false}) {
            converted c = convert(to, t);
            EXPECT_TRUE(c.rc == 0 && c.text == std::string(t.c_str(), t.size() + 1)) << t;  // the NUL counted
        }
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

TEST(Codeset, AllocationFailureGives89AndFreesWhatWasBuilt) {
    ASSERT_EQ(convert(false, "open").rc, 0);  // the handle opened outside the failures
    EXPECT_GE(rytest::for_each_alloc_failure([&] { return convert(false, "mechanism").rc; },
                                             [&](int32_t rc, long nth) {
                                                 EXPECT_TRUE(rc == 6 && rytest::error_msgnum() == 89) << nth;
                                             }),
              1);
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
