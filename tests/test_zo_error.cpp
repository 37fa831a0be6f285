// The error slot and the positional formatter.
#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "ry_zo.h"
#include "ryacl_error.h"
#include "ryacl_test_support.h"

namespace {

TEST(ErrorSlot, SetGetClearAndLastRecordWins) {
    zo_set_no_error_1();
    zo_error_t *rec = reinterpret_cast<zo_error_t *>(1);
    EXPECT_EQ(zo_get_error_1(&rec), 0);
    EXPECT_EQ(rec, nullptr);

    acl::set_error(4, 146, "-c");
    acl::set_error(4, 147);
    ASSERT_EQ(zo_get_error_1(&rec), 0);
    ASSERT_NE(rec, nullptr);
    EXPECT_EQ(rec->zo_error_id, 4);
    EXPECT_EQ(rec->zo_msg_num, 147);
    EXPECT_EQ(rec->zo_msg_set, 1);
    EXPECT_STREQ(rec->zo_msg_cat, "ryseclib.cat");
    EXPECT_EQ(rec->zo_ffdc_id, nullptr);
    EXPECT_STREQ(rec->zo_msg_default, zo_mesgtbl_ryseclib_msg[147]);
    EXPECT_EQ(rec->zo_arg_cnt, 0u);
    zo_rel_error_1(rec);

    zo_set_no_error_1();
    EXPECT_EQ(rytest::error_code(), 0);
}

TEST(ErrorSlot, StringArgumentsAreCopiedWhenRecorded) {
    char name[32];
    std::strcpy(name, "/etc/acl/first");
    acl::set_error(37, 124, name, 2);
    std::strcpy(name, "/etc/acl/OTHER!");
    std::string text = rytest::error_text();
    EXPECT_NE(text.find("Unable to open the ACL file: /etc/acl/first.\n"), std::string::npos) << text;
    EXPECT_NE(text.find("open() subroutine: 2.\n"), std::string::npos);

    // A copy handed out is independent of later changes to the slot.
    zo_error_t *rec = nullptr;
    ASSERT_EQ(zo_get_error_1(&rec), 0);
    acl::set_error(4, 146, "-v");
    EXPECT_STREQ(rec->zo_args[0].zo_arg_value.zo_arg_char_str, "/etc/acl/first");
    // Restoring the saved copy brings the earlier error back whole.
    zo_pset_error_1(rec);
    zo_rel_error_1(rec);
    EXPECT_EQ(rytest::error_msgnum(), 124);
    EXPECT_NE(rytest::error_text().find("/etc/acl/first"), std::string::npos);
    zo_pset_error_1(nullptr);
    EXPECT_EQ(rytest::error_code(), 0);
}

TEST(Formatter, EveryPlaceholderKindOfTheTable) {
    // "%1$s %2$d 0x%3$x": a pointer-sized value shows its low 32 bits in hex.
    acl::set_error(4, 88, "sec_create_acle", 5, 0xdeadbeefu);
    std::string t = rytest::error_text();
    EXPECT_NE(t.find("\tFunction name: sec_create_acle\n\tPositional parameter number: 5\n"
                     "\tParameter value: 0xdeadbeef\n"),
              std::string::npos)
        << t;
    // "0x%1$08x" pads to eight digits.
    acl::set_error(36, 164, 0x2000);
    EXPECT_NE(rytest::error_text().find("(0x00002000) does not correspond"), std::string::npos);
    // "%1$c" prints one character.
    acl::set_error(43, 161, 'g', "staff");
    EXPECT_NE(rytest::error_text().find("ACLE type: g; ACLE identifier: staff.\n"), std::string::npos);
    // A negative int with %d stays negative; with %x it shows 32 bits.
    acl::set_error(23, 91, "unit", -1, -2);
    t = rytest::error_text();
    EXPECT_NE(t.find("\tLine number: -1\n\tError code: -2\n"), std::string::npos) << t;
}

TEST(Formatter, SkippedPositionTakesNoArgument) {
    // 113 uses only positions 2 and 3: the two values land there.
    acl::set_error(43, 113, "security/ACL/lib/ryacl_acl", 812);
    std::string t = rytest::error_text();
    EXPECT_NE(t.find("(security/ACL/lib/ryacl_acl:812)\n"), std::string::npos) << t;
    zo_error_t *rec = nullptr;
    ASSERT_EQ(zo_get_error_1(&rec), 0);
    ASSERT_EQ(rec->zo_arg_cnt, 3u);
    EXPECT_EQ(rec->zo_args[0].zo_arg_type, ZO_ERROR_ARG_RESERVED);
    EXPECT_EQ(rec->zo_args[1].zo_arg_type, ZO_ERROR_ARG_CHAR_STR);
    EXPECT_EQ(rec->zo_args[2].zo_arg_type, ZO_ERROR_ARG_INT);
    zo_rel_error_1(rec);

    // The public variadic form reads exactly positions 2 and 3 too.
    zo_set_error_1(43, nullptr, "no-such-catalog.cat", 1, 114, zo_mesgtbl_ryseclib_msg[114], "file.c", 7);
    EXPECT_NE(rytest::error_text().find("(file.c:7)\n"), std::string::npos);
}

TEST(Formatter, FewerArgumentsThanPlaceholdersPrintWhatItHas) {
    // Only the first of three values given: the others format as nothing,
    // and nothing past the one value is read.
    zo_error_arg_t one;
    one.zo_arg_type = ZO_ERROR_ARG_CHAR_STR;
    one.zo_arg_value.zo_arg_char_str = const_cast<char *>("f");
    zo_set_error_argv_1(4, nullptr, "no-such-catalog.cat", 1, 88, zo_mesgtbl_ryseclib_msg[88], 1, &one);
    std::string t = rytest::error_text();
    EXPECT_NE(t.find("\tFunction name: f\n\tPositional parameter number: \n\tParameter value: 0x\n"),
              std::string::npos)
        << t;
    // A value of another kind than the placeholder asks for is shown by its
    // own kind rather than reinterpreted.
    zo_error_arg_t num;
    num.zo_arg_type = ZO_ERROR_ARG_INT;
    num.zo_arg_value.zo_arg_int = 42;
    zo_set_error_argv_1(4, nullptr, "no-such-catalog.cat", 1, 127, zo_mesgtbl_ryseclib_msg[127], 1, &num);
    EXPECT_NE(rytest::error_text().find("routine (42)\n"), std::string::npos);
}

TEST(Formatter, LiteralPercentAndMalformedPlaceholders) {
    zo_set_error_1(1, nullptr, "no-such-catalog.cat", 1, 9, "100%% of %1$s; %z %1$q %0$s %9999$s end\n", "x");
    EXPECT_EQ(rytest::error_text(), "100% of x; %z %1$q %0$s  end\n");
}

TEST(Formatter, LongArgumentsAreNotCutShort) {
    std::string dir(3000, 'd'), name(1500, 'n');
    acl::set_error(105, 153, dir.c_str(), name.c_str());
    std::string t = rytest::error_text();
    EXPECT_NE(t.find("Current working directory: " + dir + "\nACL file name: " + name + "\n"), std::string::npos);
}

TEST(MessageTable, NumbersOutsideTheTableGiveTheBadIdText) {
    EXPECT_STREQ(acl::msg_text(623), zo_badid_ryseclib_msg);
    EXPECT_STREQ(acl::msg_text(-1), zo_badid_ryseclib_msg);
    EXPECT_STREQ(zo_badid_ryseclib_msg, "Bad message id for message set ryseclib_msg");
    EXPECT_STREQ(acl::msg_text(0), "Reserved: DO NOT USE!");
    acl::set_error(4, 9999);
    EXPECT_EQ(rytest::error_text(), "Bad message id for message set ryseclib_msg");
}

TEST(ErrorSlot, NullArgumentsAreRefused) {
    EXPECT_NE(zo_get_error_1(nullptr), 0);
    char *text = reinterpret_cast<char *>(1);
    EXPECT_NE(zo_get_errmsg_1(nullptr, &text), 0);
    EXPECT_EQ(text, nullptr);
    zo_rel_error_1(nullptr);
    zo_rel_errmsg_1(nullptr);
}

}  // namespace
