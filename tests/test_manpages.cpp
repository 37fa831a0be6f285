// The manual pages must describe what the programs do: every user option of
// the checker, every default permission letter with its bit, every option
// of ryaclq's help, printed ids that belong to their message numbers; and
// groff must render them without a single warning.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <regex>
#include <set>
#include <string>
#include <vector>

#include "ryacl_acl_entry.h"
#include "ryacl_error.h"
#include "ryacl_test_support.h"

namespace {

const std::string kManDir = std::string(RYACL_SOURCE_DIR) + "/man/";
const char *const kPages[] = {"ryaclfck.1", "ryaclq.1", "ryacl.3", "ryacl.5"};

std::string find_groff() {
    const char *path = std::getenv("PATH");
    std::string p = path ? path : "/usr/bin:/bin";
    size_t start = 0;
    while (start <= p.size()) {
        size_t colon = p.find(':', start);
        std::string dir = p.substr(start, colon == std::string::npos ? std::string::npos : colon - start);
        std::string cand = (dir.empty() ? "." : dir) + "/groff";
        if (access(cand.c_str(), X_OK) == 0) return cand;
        if (colon == std::string::npos) break;
        start = colon + 1;
    }
    return "";
}

// Plain text, one long line per paragraph, no hyphenation, so that a
// pattern is never split by the formatter.
std::string render(const std::string &groff, const std::string &page) {
    auto r = rytest::run({groff, "-man", "-Tascii", "-P-cbou", "-rLL=250n", "-rHY=0", kManDir + page});
    EXPECT_EQ(r.status, 0) << page << ": " << r.err;
    return r.out;
}

// The text between the heading `name` and the next heading.
std::string section(const std::string &text, const std::string &name) {
    size_t at = text.find("\n" + name + "\n");
    if (at == std::string::npos) return "";
    at += name.size() + 2;
    std::smatch m;
    std::string rest = text.substr(at);
    if (std::regex_search(rest, m, std::regex("\n[A-Z][A-Z ]+\n"))) return rest.substr(0, m.position(0));
    return rest;
}

bool has_line(const std::string &text, const std::string &pattern) {
    return std::regex_search(text, std::regex(pattern, std::regex::multiline));
}

class ManPages : public ::testing::Test {
protected:
    void SetUp() override {
        groff_ = find_groff();
        if (groff_.empty()) GTEST_SKIP() << "groff is not installed";
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
    std::string options = section(render(groff_, "ryaclfck.1"), "OPTIONS");
    ASSERT_FALSE(options.empty());
    // The checker's option string; -S and -t are kept out of every help text.
    const std::string optstring = "cf:hsSt:u:v";
    for (char c : optstring) {
        if (c == ':' || c == 'S' || c == 't') continue;
        bool takes_arg = optstring.find(std::string(1, c) + ":") != std::string::npos;
        std::string item = std::string("^ +-") + c + (takes_arg ? " [a-z]+$" : " ");
        EXPECT_TRUE(has_line(options, item)) << "option -" << c;
    }
    EXPECT_FALSE(has_line(options, "^ +-[St]\\b"));
}

TEST_F(ManPages, FormatPageListsEveryDefaultLetterWithItsBit) {
    std::string text = render(groff_, "ryacl.5");
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
    std::string text = render(groff_, "ryaclq.1");
    std::regex opt("^  (-[a-zA-Z]), (--[a-z-]+)", std::regex::multiline);
    int seen = 0;
    for (std::sregex_iterator it(help.out.begin(), help.out.end(), opt), end; it != end; ++it, ++seen) {
        std::string item = "^ +" + (*it)[1].str() + ", " + (*it)[2].str() + "\\b";
        EXPECT_TRUE(has_line(text, item)) << (*it)[2].str();
    }
    EXPECT_GE(seen, 10);  // the pattern still matches the help's layout
}

// "4471-168 (154)" in a page must name message 154, whose text begins with
// that id; every other printed id must exist.
TEST_F(ManPages, PrintedIdsBelongToTheirMessages) {
    std::set<std::string> known;
    for (int n = 88; n <= 166; ++n) {
        const char *t = zo_mesgtbl_ryseclib_msg[n];
        if (t && std::string(t).rfind("4471-", 0) == 0) known.insert(std::string(t, 8));
    }
    std::set<int> checker_numbers;
    for (const char *page : kPages) {
        std::string text = render(groff_, page);
        std::regex pair("(4471-[0-9]{3}) \\(([0-9]+)\\)");
        for (std::sregex_iterator it(text.begin(), text.end(), pair), end; it != end; ++it) {
            int n = std::stoi((*it)[2].str());
            ASSERT_TRUE(n >= 0 && n <= 622) << page;
            EXPECT_EQ(std::string(zo_mesgtbl_ryseclib_msg[n]).substr(0, 8), (*it)[1].str()) << page;
            if (std::string(page) == "ryaclfck.1") checker_numbers.insert(n);
        }
        std::regex id("4471-[0-9]{3}");
        for (std::sregex_iterator it(text.begin(), text.end(), id), end; it != end; ++it)
            EXPECT_TRUE(known.count(it->str())) << page << ": " << it->str();
    }
    // Every message the checker itself can print is explained in its page.
    for (int n : {89, 122, 126, 127, 129, 130, 131, 132, 135, 136, 137, 138, 139, 141, 142, 144, 145,
                  146, 147, 148, 149, 150, 151, 152, 153, 154, 155, 156, 157, 158, 159, 160, 161, 162,
                  163, 165, 166})
        EXPECT_TRUE(checker_numbers.count(n)) << "message " << n << " is not in ryaclfck(1)";
}

}  // namespace
