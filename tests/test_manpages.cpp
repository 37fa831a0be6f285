// The manual pages must describe what the programs do: every user option of
// the checker, every default permission letter with its bit, every option
// of ryaclq's help, printed ids that belong to their message numbers; and
// groff must render them without a single warning.
#include <gtest/gtest.h>

#include <cstdio>
#include <regex>
#include <set>
#include <string>

#include "ryacl_acl_entry.h"
#include "ryacl_error.h"
#include "ryacl_test_support.h"

namespace {

const std::string kManDir = std::string(RYACL_SOURCE_DIR) + "/man/";
const char *const kPages[] = {"ryaclfck.1", "ryaclq.1", "ryacl.3", "ryacl.5"};

bool has_line(const std::string &text, const std::string &pattern) {
    return std::regex_search(text, std::regex(pattern, std::regex::multiline));
}

class ManPages : public ::testing::Test {
protected:
    void SetUp() override {
        groff_ = rytest::run({"/bin/sh", "-c", "command -v groff"}).out;
        if (groff_.empty()) GTEST_SKIP() << "groff is not installed";
        groff_.pop_back();  // the newline
    }
    // Plain text, one long line per paragraph, no hyphenation, so that a
    // pattern is never split by the formatter.
    std::string render(const std::string &page) {
        auto r = rytest::run({groff_, "-man", "-Tascii", "-P-cbou", "-rLL=250n", "-rHY=0", kManDir + page});
        EXPECT_EQ(r.status, 0) << page << ": " << r.err;
        return r.out;
    }
    std::string groff_;
};

TEST_F(ManPages, RenderWithoutWarnings) {
    for (const char *page : kPages) {
        auto r = rytest::run({groff_, "-man", "-ww", "-z", kManDir + page});
        EXPECT_EQ(r.status, 0) << page;
        EXPECT_EQ(r.err, "") << page;
    }
}

TEST_F(ManPages, CheckerPageDocumentsEveryUserOption) {
    const std::string text = render("ryaclfck.1");
    std::smatch m;  // the OPTIONS section, up to the next heading
    ASSERT_TRUE(std::regex_search(text, m, std::regex("\nOPTIONS\n([\\s\\S]*?)\n[A-Z][A-Z ]+\n")));
    const std::string options = m[1].str();
    // The checker's options (cf:hsSt:u:v); -S and -t are kept out of every help text.
    for (const char *item : {"-c ", "-f [a-z]+$", "-h ", "-s ", "-u [a-z]+$", "-v "})
        EXPECT_TRUE(has_line(options, std::string("^ +") + item)) << item;
    EXPECT_FALSE(has_line(options, "^ +-[St]\\b"));
}

TEST_F(ManPages, FormatPageListsEveryDefaultLetterWithItsBit) {
    const std::string text = render("ryacl.5");
    ASSERT_GT(acl__default_perm_set.count, 0);
    for (int32_t i = 0; i < acl__default_perm_set.count; ++i) {
        const sec_perm_desc &p = acl__default_perm_set.perms[i];
        char pattern[64];
        std::snprintf(pattern, sizeof pattern, "^ +%c +0x%08x ", p.printchar, p.code);
        EXPECT_TRUE(has_line(text, pattern)) << "letter " << p.printchar;
    }
}

TEST_F(ManPages, QueryPageDocumentsEveryOptionOfItsHelp) {
    auto help = rytest::run({RYACLQ_PATH, "--help"});
    ASSERT_EQ(help.status, 0);
    const std::string text = render("ryaclq.1");
    std::regex opt("^  (-[a-zA-Z]), (--[a-z-]+)", std::regex::multiline);
    int seen = 0;
    for (std::sregex_iterator it(help.out.begin(), help.out.end(), opt), end; it != end; ++it, ++seen)
        EXPECT_TRUE(has_line(text, "^ +" + (*it)[1].str() + ", " + (*it)[2].str() + "\\b")) << (*it)[2].str();
    EXPECT_GE(seen, 10);  // the pattern still matches the help's layout
}

// "4471-168 (154)" in a page must name message 154, whose text begins with
// that id; every other printed id must exist; every message the checker
// itself can print is explained in its page.
TEST_F(ManPages, PrintedIdsBelongToTheirMessages) {
    std::set<std::string> known;
    for (int n = 88; n <= 166; ++n)
        if (const char *t = zo_mesgtbl_ryseclib_msg[n]; t && std::string(t).rfind("4471-", 0) == 0)
            known.insert(std::string(t, 8));
    std::set<int> checker_numbers;
    const std::regex pair("(4471-[0-9]{3}) \\(([0-9]+)\\)"), id("4471-[0-9]{3}");
    for (const char *page : kPages) {
        const std::string text = render(page);
        for (std::sregex_iterator it(text.begin(), text.end(), pair), end; it != end; ++it) {
            const int n = std::stoi((*it)[2].str());
            ASSERT_TRUE(n >= 0 && n <= 622) << page;
            EXPECT_EQ(std::string(zo_mesgtbl_ryseclib_msg[n]).substr(0, 8), (*it)[1].str()) << page;
            if (std::string(page) == "ryaclfck.1") checker_numbers.insert(n);
        }
        for (std::sregex_iterator it(text.begin(), text.end(), id), end; it != end; ++it)
            EXPECT_TRUE(known.count(it->str())) << page << ": " << it->str();
    }
    for (int n : {89, 122, 126, 127, 129, 130, 131, 132, 135, 136, 137, 138, 139, 141, 142, 144, 145, 146, 147,
                  148, 149, 150, 151, 152, 153, 154, 155, 156, 157, 158, 159, 160, 161, 162, 163, 165, 166})
        EXPECT_TRUE(checker_numbers.count(n)) << "message " << n << " is not in ryaclfck(1)";
}

}  // namespace
