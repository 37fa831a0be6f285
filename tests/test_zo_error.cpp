// The error slot, the positional formatter, and the message table with its
// compiled catalog.  (Translated catalogs: test_l10n.)
#include <gtest/gtest.h>
#include <nl_types.h>

#include <cstring>
#include <functional>
#include <string>

#include "ry_zo.h"
#include "ryacl_error.h"
#include "ryacl_test_support.h"

namespace {

const size_t npos = std::string::npos;

TEST(ErrorSlot, RecordsCopiesRestoresAndClears) {
    acl::set_error(4, 147);
    zo_set_no_error_1();
    zo_error_t *rec = reinterpret_cast<zo_error_t *>(1);
    EXPECT_TRUE(zo_get_error_1(&rec) == 0 && rec == nullptr);
    char name[32];
    std::strcpy(name, "/etc/acl/first");
    acl::set_error(4, 146, "-c");
    acl::set_error(37, 124, name, 2);  // the last record wins; its texts are copied
    std::strcpy(name, "/etc/acl/OTHER!");
    const std::string text = rytest::error_text();
    EXPECT_NE(text.find("Unable to open the ACL file: /etc/acl/first.\n"), npos) << text;
    EXPECT_NE(text.find("open() subroutine: 2.\n"), npos) << text;
    ASSERT_EQ(zo_get_error_1(&rec), 0);
    ASSERT_NE(rec, nullptr);
    EXPECT_TRUE(rec->zo_error_id == 37 && rec->zo_msg_num == 124 && rec->zo_msg_set == 1 && !rec->zo_ffdc_id);
    EXPECT_STREQ(rec->zo_msg_cat, "ryseclib.cat");
    EXPECT_STREQ(rec->zo_msg_default, zo_mesgtbl_ryseclib_msg[124]);
    acl::set_error(4, 147);  // the copy handed out does not follow the slot
    EXPECT_STREQ(rec->zo_args[0].zo_arg_value.zo_arg_char_str, "/etc/acl/first");
    zo_pset_error_1(rec);  // restoring it brings the error back whole
    zo_rel_error_1(rec);
    EXPECT_EQ(rytest::error_text(), text);
    zo_pset_error_1(nullptr);
    EXPECT_EQ(rytest::error_code(), 0);

    EXPECT_NE(zo_get_error_1(nullptr), 0);
    char *none = reinterpret_cast<char *>(1);
    EXPECT_NE(zo_get_errmsg_1(nullptr, &none), 0);
    EXPECT_EQ(none, nullptr);
    zo_rel_error_1(nullptr);
    zo_rel_errmsg_1(nullptr);
}

TEST(Formatter, PlaceholderKindsPositionsAndMalformedFormats) {
    const std::string dir(3000, 'd'), name(1500, 'n');
    zo_error_arg_t one{ZO_ERROR_ARG_CHAR_STR, {}}, num{ZO_ERROR_ARG_INT, {}};
    one.zo_arg_value.zo_arg_char_str = const_cast<char *>("f");
    num.zo_arg_value.zo_arg_int = 42;
    const char *const *tbl = zo_mesgtbl_ryseclib_msg;
    const struct { std::function<void()> record; std::string shows; bool whole; } cases[] = {
        // %s %d 0x%x: a pointer-sized value shows its low 32 bits.
        {[] { acl::set_error(4, 88, "sec_create_acle", 5, 0xdeadbeefu); },
         "\tFunction name: sec_create_acle\n\tPositional parameter number: 5\n\tParameter value: 0xdeadbeef\n", false},
        {[] { acl::set_error(36, 164, 0x2000); }, "(0x00002000) does not correspond", false},  // %08x
        {[] { acl::set_error(43, 161, 'g', "staff"); }, "ACLE type: g; ACLE identifier: staff.\n", false},  // %c
        {[] { acl::set_error(23, 91, "unit", -1, -2); }, "\tLine number: -1\n\tError code: -2\n", false},
        // 113 and 114 use only positions 2 and 3: the two values land there.
        {[] { acl::set_error(43, 113, "security/ACL/lib/ryacl_acl", 812); }, "(security/ACL/lib/ryacl_acl:812)\n", false},
        {[&] { zo_set_error_1(43, nullptr, "no-such-catalog.cat", 1, 114, tbl[114], "file.c", 7); }, "(file.c:7)\n", false},
        // Fewer values than placeholders: the rest format as nothing, nothing more is read.
        {[&] { zo_set_error_argv_1(4, nullptr, "no-such-catalog.cat", 1, 88, tbl[88], 1, &one); },
         "\tFunction name: f\n\tPositional parameter number: \n\tParameter value: 0x\n", false},
        // A value of another kind than asked for is shown as its own kind.
        {[&] { zo_set_error_argv_1(4, nullptr, "no-such-catalog.cat", 1, 127, tbl[127], 1, &num); }, "routine (42)\n", false},
        {[&] { acl::set_error(105, 153, dir.c_str(), name.c_str()); },
         "Current working directory: " + dir + "\nACL file name: " + name + "\n", false},
        {[] { zo_set_error_1(1, nullptr, "no-such-catalog.cat", 1, 9, "100%% of %1$s; %z %1$q %0$s %9999$s end\n", "x"); },
         "100% of x; %z %1$q %0$s  end\n", true},
        {[] { acl::set_error(4, 9999); }, "Bad message id for message set ryseclib_msg", true},
    };
    for (const auto &c : cases) {
        c.record();
        const std::string t = rytest::error_text();
        EXPECT_TRUE(c.whole ? t == c.shows : t.find(c.shows) != npos) << t;
    }
    acl::set_error(43, 113, "file.c", 1);  // a skipped position is a reserved record
    zo_error_t *rec = nullptr;
    ASSERT_EQ(zo_get_error_1(&rec), 0);
    EXPECT_TRUE(rec->zo_arg_cnt == 3 && rec->zo_args[0].zo_arg_type == ZO_ERROR_ARG_RESERVED &&
                rec->zo_args[1].zo_arg_type == ZO_ERROR_ARG_CHAR_STR && rec->zo_args[2].zo_arg_type == ZO_ERROR_ARG_INT);
    zo_rel_error_1(rec);
}

TEST(MessageTable, PrintedIdsAndTheCompiledCatalogAgree) {
    EXPECT_STREQ(acl::msg_text(RYSECLIB_MSG_COUNT), zo_badid_ryseclib_msg);
    EXPECT_STREQ(acl::msg_text(-1), zo_badid_ryseclib_msg);
    EXPECT_STREQ(acl::msg_text(0), "Reserved: DO NOT USE!");
    const std::string path = std::string(RYACL_BINARY_DIR) + "/share/ryacl/ryseclib.cat";
    nl_catd cat = catopen(path.c_str(), 0);
    ASSERT_NE(cat, reinterpret_cast<nl_catd>(-1)) << path;
    static const char kMissing[] = "";
    for (int n = 1; n < RYSECLIB_MSG_COUNT; ++n) {
        const std::string t = zo_mesgtbl_ryseclib_msg[n];
        const char *c = catgets(cat, 1, n, kMissing);
        EXPECT_TRUE(t.empty() ? c == kMissing : c != kMissing && t == c) << n;
        if (t.empty()) continue;
        EXPECT_EQ(t.back(), '\n') << n;
        // 88..145 print 4471-(n+13), 146 on 4471-(n+14); the help texts below 88 none.
        EXPECT_EQ(t.find("4471-"), n < 88 ? npos : 0u) << n;
        if (n >= 88) { EXPECT_EQ(t.find("4471-" + std::to_string(n <= 145 ? n + 13 : n + 14) + " "), 0u) << n; }
    }
    catclose(cat);
    EXPECT_NE(std::string(zo_mesgtbl_ryseclib_msg[121]).find("NULL ('\\0') character"), npos);  // a backslash kept
}

}  // namespace
