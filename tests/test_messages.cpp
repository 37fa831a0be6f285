// Message names and the allocation-failure helper: every named message is the
// table's message of that number with as many arguments as its text has
// placeholders, and the helper records message 89 as the call sites did.
#include <gtest/gtest.h>

#include <climits>
#include <regex>
#include <set>
#include <string>

#include "ryacl.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"
#include "ryacl_test_support.h"

namespace {

// Distinct placeholder positions of a default text.
unsigned positions(const char *text) {
    static const std::regex ph(R"(%([0-9]+)\$)");
    std::set<std::string> seen;
    const std::string s = text;
    for (std::sregex_iterator it(s.begin(), s.end(), ph), end; it != end; ++it) seen.insert((*it)[1]);
    return static_cast<unsigned>(seen.size());
}

template <class Id>
void expect_named(Id id, int32_t num, const char *name) {
    SCOPED_TRACE(name);
    EXPECT_EQ(id.num, num);
    EXPECT_NE(std::string(acl::msg_text(id.num)), "");
    EXPECT_EQ(id.arity, positions(acl::msg_text(id.num)));
}

TEST(MessageNames, NameNumberAndArityAgreeWithTheTable) {
    expect_named(acl::msg::BAD_PARAM, 88, "BAD_PARAM");
    expect_named(acl::msg::NO_MEMORY, 89, "NO_MEMORY");
    expect_named(acl::msg::DUMP_SUBACL, 84, "DUMP_SUBACL");  // six arguments
    expect_named(acl::msg::ACLE_ID_UNEXPECTED, 113, "ACLE_ID_UNEXPECTED");  // skips position 1
    expect_named(acl::msg::BAD_ACL, 93, "BAD_ACL");  // none
    expect_named(acl::msg::LINE_BAD_PERMS, 166, "LINE_BAD_PERMS");  // the last
}

TEST(MessageNames, NamedAndNumberedRecordsAreTheSame) {
    acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "fn", 2, 0x1234);
    const std::string numbered = rytest::error_text();
    acl::set_error(ACL_RC_BAD_ARGS, acl::msg::BAD_PARAM, "fn", 2, 0x1234);
    EXPECT_EQ(rytest::error_msgnum(), 88);
    EXPECT_EQ(rytest::error_text(), numbered);
    acl::clear_error();
}

TEST(NoMemory, RecordsMessage89WithTheFunctionAndASizeCappedAtInt32Max) {
    EXPECT_EQ(acl__no_memory("sec_list_acl", 4096), ACL_RC_NO_MEMORY);
    EXPECT_EQ(rytest::error_code(), ACL_RC_NO_MEMORY);
    EXPECT_EQ(rytest::error_msgnum(), 89);
    EXPECT_NE(rytest::error_text().find("Function name: sec_list_acl\n"), std::string::npos);
    EXPECT_NE(rytest::error_text().find("Attempted allocation: 4096 bytes"), std::string::npos);
    acl__no_memory("f", size_t{1} << 40);
    EXPECT_NE(rytest::error_text().find("Attempted allocation: 2147483647 bytes"), std::string::npos);
    acl::clear_error();
}

TEST(NoMemory, MallocOrRecordFailsOnlyThroughTheHook) {
    void *p = acl__malloc_or_record("f", 16);
    ASSERT_NE(p, nullptr);
    EXPECT_EQ(rytest::error_code(), 0);
    std::free(p);
    rytest::alloc_fail_nth(1);
    EXPECT_EQ(acl__malloc_or_record("sec_create_acle", 24), nullptr);
    rytest::alloc_fail_none();
    EXPECT_EQ(rytest::error_msgnum(), 89);
    EXPECT_NE(rytest::error_text().find("Function name: sec_create_acle\n\tAttempted allocation: 24 bytes"),
              std::string::npos);
    acl::clear_error();
}

}  // namespace
