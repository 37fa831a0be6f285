// The default message table and the compiled catalog agree, and every
// message the system issues has the printed id and placeholders its callers
// pass values for.
#include <gtest/gtest.h>
#include <nl_types.h>

#include <cstring>
#include <string>
#include <vector>

#include "ryacl_error.h"
#include "ryacl_test_support.h"

namespace {

struct used_message {
    int num;
    const char *placeholders;  // the positional placeholders, in order of position
};

// Every message the library and the checker issue, with the kinds of values
// their callers pass.  A text edited so that a placeholder changes kind or
// position breaks the callers: this table catches it.
const used_message kUsed[] = {
    {80, ""}, {81, ""}, {82, ""}, {83, "%1$d %2$d %3$d %4$d"}, {84, "%1$s %2$s %3$d %4$d %5$s %6$d"},
    {85, "%1$s %2$c %3$s %4$s %5$s"}, {86, "%1$s %2$c %3$s %4$s"}, {87, "%1$s %2$c %3$s"},
    {88, "%1$s %2$d %3$x"}, {89, "%1$s %2$d"}, {91, "%1$s %2$d %3$d"}, {93, ""}, {94, "%1$d"}, {95, ""},
    {96, ""}, {97, "%1$s %2$d"}, {98, ""}, {100, ""}, {101, ""}, {102, ""}, {103, "%1$d"}, {104, "%1$d"},
    {105, "%1$d %2$s %3$s"}, {106, "%1$d %2$s %3$d"}, {107, "%1$d %2$s %3$d"}, {108, "%1$d %2$s %3$d"},
    {109, "%1$s %2$d"}, {110, "%1$d %2$s %3$d"}, {111, "%1$s %2$s %3$d"}, {112, "%1$d %2$s %3$d"},
    {113, "%2$s %3$d"}, {114, "%2$s %3$d"}, {115, "%1$d"}, {116, ""}, {117, ""}, {118, "%1$s %2$d %3$d"},
    {119, ""}, {121, ""}, {122, "%1$s %2$d"}, {124, "%1$s %2$d"}, {126, "%1$d %2$d %3$d"}, {127, "%1$s"},
    {128, "%1$s %2$s"}, {129, ""}, {130, ""}, {131, "%1$d"}, {132, "%1$s %2$d"}, {133, "%1$c"},
    {134, "%1$d %2$s %3$s"}, {135, "%1$s"}, {136, "%1$s"}, {137, "%1$s"}, {138, "%1$s"},
    {139, "%1$d %2$d %3$d"}, {141, "%1$s %2$s %3$d"}, {142, "%1$s %2$x"}, {144, "%1$c %2$s %3$s"},
    {145, "%1$d"}, {146, "%1$s"}, {147, ""}, {148, ""}, {149, ""}, {150, ""}, {151, "%1$s %2$s"},
    {152, "%1$s %2$d"}, {153, "%1$s %2$s"}, {154, "%1$s %2$d"}, {155, "%1$s %2$s"}, {156, "%1$s %2$d"},
    {157, "%1$s"}, {158, "%1$d"}, {159, "%1$d"}, {160, "%1$c"}, {161, "%1$c %2$s"}, {162, ""},
    {163, "%1$s %2$s"}, {164, "%1$08x"}, {165, "%1$d %2$s"}, {166, "%1$d %2$s"},
};

// The distinct placeholders of a text in order of position.
std::string placeholders_of(const std::string &t) {
    std::vector<std::string> found(20);
    for (size_t i = 0; i + 1 < t.size(); ++i) {
        if (t[i] != '%') continue;
        size_t j = i + 1;
        int pos = 0;
        while (j < t.size() && isdigit(static_cast<unsigned char>(t[j]))) pos = pos * 10 + (t[j++] - '0');
        if (j >= t.size() || t[j] != '$' || pos <= 0 || pos >= 20) continue;
        size_t k = j + 1;
        while (k < t.size() && (isdigit(static_cast<unsigned char>(t[k])))) ++k;
        if (k < t.size()) found[pos] = t.substr(i, k + 1 - i);
    }
    std::string out;
    for (const auto &f : found)
        if (!f.empty()) out += (out.empty() ? "" : " ") + f;
    return out;
}

TEST(MessageTable, UsedMessagesHaveTheirIdsAndPlaceholders) {
    for (const auto &m : kUsed) {
        SCOPED_TRACE(m.num);
        std::string t = zo_mesgtbl_ryseclib_msg[m.num];
        ASSERT_FALSE(t.empty());
        EXPECT_EQ(t.back(), '\n');
        EXPECT_EQ(placeholders_of(t), m.placeholders);
        if (m.num >= 88) {
            // 88..145 print 4471-(n+13); 146..166 print 4471-(n+14).
            int printed = m.num <= 145 ? m.num + 13 : m.num + 14;
            EXPECT_EQ(t.rfind("4471-" + std::to_string(printed) + " ", 0), 0u);
        } else {
            EXPECT_EQ(t.find("4471-"), std::string::npos);
        }
    }
}

TEST(MessageTable, HelpAndUsageTextsAreExact) {
    EXPECT_STREQ(zo_mesgtbl_ryseclib_msg[80],
                 "Syntax:\n\tryaclfck [-c] [-s] [-u <username>] [-v] -f <ACL file name>\nor, for help:\n"
                 "\tryaclfck -h\n");
    std::string help = zo_mesgtbl_ryseclib_msg[81];
    EXPECT_EQ(help.rfind("ryaclfck: Checks an ACL file for syntactical validity.\nSyntax:\n", 0), 0u);
    EXPECT_NE(help.find("\nOptions:\n\t -c \t Continues the checking until the end of the file, treating\n"
                        "\t    \t errors as warnings."),
              std::string::npos);
    EXPECT_NE(help.find("an added extension of \".cacl\".  The ownership\n"), std::string::npos);
    EXPECT_NE(help.find("\t -v \t This option specifies the verbose mode in which case the\n"
                        "\t    \t command displays the entries in the ACL file.\n"),
              std::string::npos);
    EXPECT_EQ(help.back(), '\n');
    // The one message with a backslash in it keeps it as text.
    EXPECT_NE(std::string(zo_mesgtbl_ryseclib_msg[121]).find("NULL ('\\0') character"), std::string::npos);
}

TEST(MessageCatalog, CompiledCatalogHoldsTheSameTexts) {
    std::string path = std::string(RYACL_BINARY_DIR) + "/share/ryacl/ryseclib.cat";
    nl_catd cat = catopen(path.c_str(), 0);
    ASSERT_NE(cat, reinterpret_cast<nl_catd>(-1)) << path;
    static const char kMissing[] = "";
    int compared = 0;
    for (int n = 1; n < RYSECLIB_MSG_COUNT; ++n) {
        const char *dflt = zo_mesgtbl_ryseclib_msg[n];
        const char *t = catgets(cat, 1, n, kMissing);
        if (!*dflt) {
            EXPECT_EQ(t, kMissing) << n;
            continue;
        }
        ASSERT_NE(t, kMissing) << n;
        EXPECT_STREQ(t, dflt) << n;
        ++compared;
    }
    EXPECT_EQ(compared, static_cast<int>(sizeof kUsed / sizeof kUsed[0]));
    catclose(cat);
}

}  // namespace
