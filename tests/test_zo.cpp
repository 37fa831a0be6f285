// The utility layer: the error formatter, ASCII case folding, IPv6 text,
// codeset conversion failures, and the trace component.
#include <arpa/inet.h>
#include <errno.h>
#include <gtest/gtest.h>
#include <nl_types.h>
#include <unistd.h>

#include <array>
#include <cstdlib>
#include <cstring>
#include <map>
#include <memory>
#include <random>
#include <regex>
#include <set>
#include <sstream>

#include "ry_zo_int.h"
#include "ryacl.h"
#include "ryacl_error.h"
#include "ryacl_test_support.h"
#include "ryacl_trace.h"
#include "ryacl_utils.h"

namespace {

namespace tr = acl::trace;
const size_t npos = std::string::npos;
int sign(int v) { return (v > 0) - (v < 0); }

TEST(ZoError, FormatterPlaceholderKindsPositionsAndMalformedFormats) {
    const std::string dir(3000, 'd'), name(1500, 'n');
    zo_error_arg_t one{ZO_ERROR_ARG_CHAR_STR, {}}, num{ZO_ERROR_ARG_INT, {}};
    one.zo_arg_value.zo_arg_char_str = const_cast<char *>("f");
    num.zo_arg_value.zo_arg_int = 42;
    const char *const *tbl = zo_mesgtbl_ryseclib_msg;
    const std::pair<std::function<void()>, std::string> cases[] = {
        // %s %d 0x%x: a pointer-sized value shows its low 32 bits.
        {[] { acl::set_error(4, acl::msg::BAD_PARAM, "sec_create_acle", 5, 0xdeadbeefu); },
         "\tFunction name: sec_create_acle\n\tPositional parameter number: 5\n\tParameter value: 0xdeadbeef\n"},
        {[] { acl::set_error(36, acl::msg::BAD_PERM_BIT, 0x2000); }, "(0x00002000) does not correspond"},       // %08x
        {[] { acl::set_error(43, acl::msg::DUPLICATE_GROUP, 'g', "staff"); }, "ACLE type: g; ACLE identifier: staff.\n"},  // %c
        {[] { acl::set_error(23, acl::msg::INTERNAL, "unit", -1, -2); }, "\tLine number: -1\n\tError code: -2\n"},
        // 113 and 114 use only positions 2 and 3: the two values land there.
        {[] { acl::set_error(43, acl::msg::ACLE_ID_UNEXPECTED, "security/ACL/lib/ryacl_acl", 812); }, "(security/ACL/lib/ryacl_acl:812)\n"},
        {[&] { zo_set_error_1(43, nullptr, "no-such-catalog.cat", 1, 114, tbl[114], "file.c", 7); }, "(file.c:7)\n"},
        // Fewer values than placeholders: the rest format as nothing, nothing more is read.
        {[&] { zo_set_error_argv_1(4, nullptr, "no-such-catalog.cat", 1, 88, tbl[88], 1, &one); },
         "\tFunction name: f\n\tPositional parameter number: \n\tParameter value: 0x\n"},
        // A value of another kind than asked for is shown as its own kind.
        {[&] { zo_set_error_argv_1(4, nullptr, "no-such-catalog.cat", 1, 127, tbl[127], 1, &num); }, "routine (42)\n"},
        {[&] { zo_set_error_argv_1(4, nullptr, "no-such-catalog.cat", 1, 91, tbl[91], 3, std::array{one, one, one}.data()); },
         "\tLine number: f\n\tError code: f\n"},
        {[&] { acl::set_error(105, acl::msg::CWD_TOO_LONG, dir.c_str(), name.c_str()); },
         "Current working directory: " + dir + "\nACL file name: " + name + "\n"},
        {[] { zo_set_error_1(1, nullptr, "none.cat", 1, 9, "100%% of %1$s; %z %1$q %0$s %9999$s end\n", "x"); },
         "100% of x; %z %1$q %0$s  end\n"},
        {[] { acl::set_error(4, 9999); }, "Bad message id for message set ryseclib_msg"},
    };
    for (const auto &[record, shows] : cases) {
        record();
        EXPECT_NE(rytest::error_text().find(shows), npos) << rytest::error_text();
    }
}

// One source makes both the built-in table and the compiled catalog: they
// agree slot for slot, and each numbered message prints its own id.
TEST(ZoError, BuiltInTableAndCompiledCatalogAgree) {
    EXPECT_STREQ(acl::msg_text(RYSECLIB_MSG_COUNT), zo_badid_ryseclib_msg);
    EXPECT_STREQ(acl::msg_text(-1), zo_badid_ryseclib_msg);
    nl_catd cat = catopen(RYACL_BINARY_DIR "/share/ryacl/ryseclib.cat", 0);
    ASSERT_NE(cat, reinterpret_cast<nl_catd>(-1));
    static const char kMissing[] = "";
    for (int n = 1; n < RYSECLIB_MSG_COUNT; ++n) {
        const std::string t = zo_mesgtbl_ryseclib_msg[n];
        const char *c = catgets(cat, 1, n, kMissing);
        EXPECT_TRUE(t.empty() ? c == kMissing : c != kMissing && t == c) << n;
        // 88..145 print 4471-(n+13), 146 on 4471-(n+14); the help texts below 88 none.
        const size_t id = t.find("4471-" + std::to_string(n <= 145 ? n + 13 : n + 14) + " ");
        EXPECT_TRUE(t.empty() || id == (n < 88 ? npos : 0u)) << n;
    }
    catclose(cat);
}

// Bytes that came from a file never drive a terminal: control characters
// of text and character arguments show as \xNN, a width counts that form,
// tab and UTF-8 pass unchanged.
TEST(ZoError, ControlCharactersInArgumentsAreEscaped) {
    acl::set_error(43, acl::msg::LINE_BAD_TYPE, 3, "\x1b[2J\x7f\tok");
    EXPECT_NE(rytest::error_text().find("valid\nACLE type (\\x1b[2J\\x7f\tok)."), npos) << rytest::error_text();
    acl::set_error(43, acl::msg::DUPLICATE_GROUP, '\x1b', "jos\xc3\xa9\x01");
    EXPECT_NE(rytest::error_text().find("ACLE type: \\x1b; ACLE identifier: jos\xc3\xa9\\x01.\n"), npos);
    zo_set_error_1(1, nullptr, "none.cat", 1, 9, "[%1$-6s][%2$6s][%3$.5s][%4$c]\n", "\x01", "a\x02", "\x03\x04", 'z');
    EXPECT_EQ(rytest::error_text(), "[\\x01  ][ a\\x02][\\x03][z]\n");
}

// The library's records (texts referred to, positions scanned once) read
// back exactly as records made through the public recorder.
TEST(ZoError, LibraryRecordsReadBackAsPublicOnes) {
    auto copy = [] {
        zo_error_t *r = nullptr;
        zo_get_error_1(&r);
        std::string s = r ? std::to_string(r->zo_error_id) + "|" + r->zo_msg_cat + "|" + std::to_string(r->zo_msg_set) +
                                "|" + std::to_string(r->zo_msg_num) + "|" + r->zo_msg_default + "|" + std::to_string(r->zo_arg_cnt)
                          : "none";
        for (uint32_t i = 0; r && i < r->zo_arg_cnt; ++i) {
            const zo_error_arg_t &a = r->zo_args[i];
            s += "|" + std::to_string(a.zo_arg_type) + ":" +
                 (a.zo_arg_type == ZO_ERROR_ARG_CHAR_STR ? std::string(a.zo_arg_value.zo_arg_char_str)
                                                         : std::to_string(a.zo_arg_value.zo_arg_int));
        }
        zo_rel_error_1(r);
        return s + "|" + rytest::error_text();
    };
    for (int repeat = 0; repeat < 2; ++repeat) {  // the second meets the scanned positions
        std::string id = "bob";
        acl::set_error(43, acl::msg::NO_MATCH, 0x84, "unix", id.c_str());
        id = "eve";  // recorded, not referred to
        const std::string lib = copy();
        zo_set_error_1(43, nullptr, RYSECLIB_CAT, 1, 134, zo_mesgtbl_ryseclib_msg[134], 0x84, "unix", "bob");
        EXPECT_EQ(lib, copy());
        acl::set_error(43, acl::msg::ACLE_ID_UNEXPECTED, "unit", 7);  // positions 2 and 3 only
        const std::string skipped = copy();
        zo_set_error_1(43, nullptr, RYSECLIB_CAT, 1, 113, zo_mesgtbl_ryseclib_msg[113], "unit", 7);
        EXPECT_EQ(skipped, copy());
    }
}

// Out of memory the report still gets through: the record refers to the
// slot, the default text is formatted into spare storage, and releasing
// either frees nothing.
TEST(ZoError, ReportWithoutMemoryFallsBackToTheDefaultText) {
    acl::set_error(6, acl::msg::NO_MEMORY, "sec_read_acl_file", 4097);
    const std::string want = rytest::error_text();
    static long asked;
    asked = 0;
    zo::set_alloc_hook([](size_t) { return ++asked, false; });
    zo_error_t *rec = nullptr;
    char *text = nullptr;
    const int got = zo_get_error_1(&rec), formatted = zo_get_errmsg_1(rec, &text);
    zo::set_alloc_hook(nullptr);
    EXPECT_EQ(asked, 2);
    EXPECT_EQ(got, 6);
    EXPECT_EQ(formatted, 6);
    ASSERT_TRUE(rec && text);
    EXPECT_EQ(rec->zo_msg_num, 89);
    EXPECT_EQ(text, want);
    EXPECT_EQ(zo_pset_error_1(rec), 0);
    zo_rel_errmsg_1(text);
    zo_rel_error_1(rec);
    EXPECT_EQ(rytest::error_text(), want);
}

// Installed, the command finds its translation from where it really is,
// started through PATH or through a link from another directory, and never
// reads a catalog relative to the directory it runs in.
TEST(ZoCatalog, InstalledCommandFindsItsTranslationNeverOneBesideTheWorkingDirectory) {
    rytest::tmp_dir d;
    const std::string prefix = d / "prefix", cwd = d / "w/x", links = d / "links";
    auto r = rytest::run({"/usr/bin/env", "cmake", "--install", RYACL_BINARY_DIR, "--prefix", prefix});
    ASSERT_EQ(r.status, 0) << r.err;
    auto catalog = [&](const std::string &target, const std::string &text148) {
        rytest::write_file(d / "t.msg", "$quote \"\n$set 1\n148 \"" + text148 + "\\n\"\n");
        ASSERT_EQ(rytest::run({"/bin/mkdir", "-p", target.substr(0, target.rfind('/'))}).status, 0);
        ASSERT_EQ(rytest::run({RYACL_GENCAT, target, d / "t.msg"}).status, 0);
    };
    catalog(prefix + "/share/ryacl/nls/C.UTF-8/ryseclib.cat", "4471-162 Echec : l'option -f manque.");
    for (const char *planted : {"/share/ryacl/ryseclib.cat", "/share/ryacl/nls/C.UTF-8/ryseclib.cat",
                                "/share/ryacl/nls/C/ryseclib.cat"})
        catalog(d / "w" + planted, "4471-162 PLANTED");
    ASSERT_EQ(rytest::run({"/bin/mkdir", "-p", cwd, links}).status, 0);
    ASSERT_EQ(symlink((prefix + "/bin/ryaclfck").c_str(), (links + "/aclcheck").c_str()), 0);
    const std::string fr = "4471-162 Echec : l'option -f manque.\n", en = acl::msg_text(148);
    for (const auto &[dir, cmd] : {std::pair{prefix + "/bin", "ryaclfck"}, std::pair{links, "aclcheck"}})
        for (const char *locale : {"C.UTF-8", "C"}) {
            r = rytest::run({"/bin/sh", "-c", std::string(cmd) + " -v"}, cwd,
                            {"PATH=" + dir + ":/usr/bin:/bin", std::string("LC_ALL=") + locale, "NLSPATH"});
            EXPECT_EQ(r.status, 4) << cmd;
            EXPECT_EQ(r.err.rfind(std::string(locale) == "C" ? en : fr, 0), 0u) << cmd << " " << locale << ":\n" << r.err;
        }
}

TEST(ZoText, PosixCaseCompareFoldsAsciiOnlyAndNStopsAtN) {
    // After an equal-folded prefix: the sign of the folded bytes as unsigned, flipped when swapped.
    for (int a = 1; a < 256; ++a) {
        ASSERT_EQ(zo_tolower_posix_1(a), (a >= 'A' && a <= 'Z') ? a + 32 : a) << a;
        for (int b = 1; b < 256; ++b) {
            char x[3] = {'K', static_cast<char>(a), 0}, y[3] = {'k', static_cast<char>(b), 0};
            int want = sign(zo_tolower_posix_1(a) - zo_tolower_posix_1(b));
            ASSERT_TRUE(sign(zo_strcasecmp_posix_1(x, y)) == want && sign(zo_strcasecmp_posix_1(y, x)) == -want)
                << a << " " << b;
        }
    }
    char a[4] = {'a', 'b', 0, 'Q'}, b[4] = {'A', 'B', 0, 'r'};  // bytes past the NUL differ
    EXPECT_TRUE(zo_strcasecmp_posix_1("ab", "ABC") < 0 && zo_strncasecmp_posix_1("abcX", "ABCy", 3) == 0 &&
                zo_strncasecmp_posix_1("abcX", "ABCy", 4) != 0 && zo_strncasecmp_posix_1("x", "y", 0) == 0 &&
                zo_strncasecmp_posix_1(a, b, 4) == 0 && zo_strncasecmp_posix_1("ab", "ABC", 3) != 0);
}

// The word-at-a-time compare of texts of known length (trees, edits and
// evaluation use it) orders exactly as the byte-wise one, also when b holds
// a NUL before its length (a hostile buffer), and reads nothing past either
// terminator: each text sits in a heap block of exactly its size.
TEST(ZoText, KnownLengthCompareAgreesWithByteWise) {
    const char alphabet[] = "aAzZ@[`{0\x7f\x80\xc3\xff";
    std::mt19937 rng(5);
    auto text = [&](size_t len, bool nul) {
        std::string t = "user0000";
        t.resize(rng() % 2 ? len : len % 9);
        for (size_t i = 8; i < t.size(); ++i) t[i] = alphabet[rng() % (sizeof alphabet - 1)];
        if (nul && !t.empty() && rng() % 4 == 0) t[rng() % t.size()] = '\0';
        return t;
    };
    for (int it = 0; it < 200000; ++it) {
        std::string x = text(rng() % 26, false), y = it % 3 ? text(rng() % 26, true) : x;
        if (it % 3 == 0 && !y.empty()) y[rng() % y.size()] ^= 0x20;  // the same text in another case
        std::unique_ptr<char[]> a(new char[x.size() + 1]), b(new char[y.size() + 1]);
        std::memcpy(a.get(), x.c_str(), x.size() + 1);
        std::memcpy(b.get(), y.c_str(), y.size() + 1);
        ASSERT_EQ(sign(zo::casecmp_len(a.get(), x.size(), b.get(), y.size())),
                  sign(zo_strcasecmp_posix_1(a.get(), b.get())))
            << it;
    }
}

TEST(ZoText, Ipv6CanonicalFormWithinTheArea) {
    // The longest zero run (leftmost on a tie, never one group) goes; only mapped IPv4 is dotted.
    struct { const char *in, *want; size_t area; } cases[] = {
        {"0:0:0:0:0:0:0:0", "::", 65}, {"0:0:0:0:0:0:0:1", "::1", 65}, {"1:0:0:0:0:0:0:0", "1::", 65},
        {"2001:0DB8:0:0:0:0:0:ABCD", "2001:db8::abcd", 65}, {"1:0:0:2:0:0:0:3", "1:0:0:2::3", 65},
        {"1:0:0:2:0:0:3:4", "1::2:0:0:3:4", 65}, {"0:0:1:2:3:4:0:0", "::1:2:3:4:0:0", 65},
        {"1:0:2:3:4:5:6:7", "1:0:2:3:4:5:6:7", 65}, {"::FFFF:0102:0304", "::ffff:1.2.3.4", 65},
        {"::fffe:1.2.3.4", "::fffe:102:304", 65}, {"2001:db8::1", "2001:db8::1", 12}, {"2001:db8::1", "", 11}};
    for (const auto &c : cases) {
        unsigned char addr[16];
        char out[65];
        std::memset(out, '#', sizeof out);
        ASSERT_EQ(inet_pton(AF_INET6, c.in, addr), 1) << c.in;
        int rc = zo_ipaddr_ntop_1(addr, out, c.area);
        EXPECT_TRUE(*c.want ? rc == 0 && std::string(out) == c.want : rc != 0 && out[0] == '#') << c.in;
    }
}

TEST(ZoText, CodesetFailuresMapToCodes) {
    for (const auto &[to, text] : {std::pair{true, "ab\x80" "cd"}, {false, "caf\xc3\xa9"}, {false, "ab\xc3"}}) {
        size_t inlen = std::strlen(text) + 1, outlen = 0;
        char *out = nullptr;
        int32_t rc = (to ? acl__convert_to_utf8 : acl__convert_from_utf8)(text, &inlen, &out, &outlen);
        EXPECT_TRUE(rc == 26 && rytest::error_msgnum() == 130 && !out) << text;
    }
    char *out = nullptr;
    size_t outlen = 0;  // no input length: argument fault 20, reported as an internal error
    EXPECT_EQ(acl__convert_to_utf8("x", nullptr, &out, &outlen), 23);
    EXPECT_TRUE(rytest::error_msgnum() == 91 && rytest::error_text().find("ryacl_utils") != npos &&
                rytest::error_text().find("Error code: 20") != npos) << rytest::error_text();
}

// Trace points of every kind, with the ids the library uses for them.
int points() {
    char area[33];
    std::memset(area, 'x', sizeof area);  // no NUL anywhere
    int32_t n = 7;
    tr::api_entry(9, 11, {tr::str("/etc/a\"cl"), tr::str(nullptr), tr::val(n)});
    tr::api_exit(13, 13, 14, 0, {tr::val(n)});   // success with a result
    tr::api_exit(26, 26, 27, 43, {tr::val(n)});  // failure: the code only
    tr::api_exit(43, 43, 6);
    tr::api_release_exit(48);
    tr::api_entry(97, 99, {tr::strn(area, sizeof area)});
    tr::point(tr::ERRORS, 115, {tr::val(n), tr::val(n)});
    tr::point(tr::INFO, 107, {tr::str("cache")});
    tr::point(tr::INFO, 114, {tr::val(n)});
    tr::point(tr::INFO, 104, {});
    tr::perf_timer t1(1), t2(2);
    t1.record(1, {tr::str("/etc/acl")});
    t2.record(6, {});
    acl__trace_unregister_component();
    tr::point(tr::ERRORS, 108, {});  // after unregistration: not recorded
    return 0;
}

// The first trace point registers: the error slot (full or empty) and errno come out unchanged.
int slot(bool empty) {
    char file[] = "security/ACL/lib/ryacl_acl";
    if (!empty) acl::set_error(42, acl::msg::ACL_CORRUPTED, file, 321);
    const std::string before = rytest::error_text();
    file[0] = 'X';  // the slot holds its own copy
    errno = EDOM;   // reading the error text may have changed it
    tr::point(tr::ERRORS, 115, {tr::str("x")});
    tr::api_exit(13, 13, 42);
    return errno != EDOM || rytest::error_text() != before || rytest::error_code() != (empty ? 0 : 42);
}

const int g_scenario = [] {
    const char *s = std::getenv("RYTEST_TRACE_SCENARIO");
    if (s) std::_Exit(std::strcmp(s, "points") == 0 ? points() : slot(std::strcmp(s, "noslot") == 0));
    return 0;
}();

TEST(Trace, LevelsSelectThePointsRecordedAsLines) {
    rytest::tmp_dir d;
    const struct { const char *scenario, *levels; std::multiset<unsigned> want; } cases[] = {
        {"points", "", {}}, {"points", "API=0,all=0,Bogus=9", {}},
        // Level 1: entry and exit ids; Info 107 only at 1.
        {"points", "api=1,ERRORS=1,Info=1", {9, 13, 26, 43, 48, 97, 104, 107, 115}},
        // Level 8: data points instead; Info 114 only above 7; Perf 8 arms no timer of 1 or 2.
        {"points", "all=8", {0, 11, 14, 26, 43, 48, 99, 104, 114, 115}},
        // Release exits at any API level; malformed entries ignored.
        {"points", "perf=2,API=3,bogus=4,Errors=x,=5,Info", {0, 6, 48}},
        {"points", "Perf=1,API=300", {0, 1, 11, 14, 26, 43, 48, 99}},  // 300 counts as 255
        {"slot", "", {}}, {"slot", "all=8", {0, 13, 115}}, {"noslot", "", {}}, {"noslot", "all=8", {0, 13, 115}},
    };
    const std::regex record(R"(\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{6}Z pid=\d+ tid=\d+ _SEL (\d+)(.*))");
    for (const auto &c : cases) {
        const std::string scenario = c.scenario, levels = c.levels, file = d / (scenario + levels);
        auto r = rytest::run({"/proc/self/exe"}, "", {"RYTEST_TRACE_SCENARIO=" + scenario, "RYACL_TRACE=" + levels,
                                                      "RYACL_TRACE_FILE=" + file});
        // Nothing recorded, no file.
        EXPECT_TRUE(r.status == 0 && rytest::file_exists(file) == !c.want.empty()) << levels << r.err;
        std::multiset<unsigned> ids;  // each id once, with the items after it
        std::map<unsigned, std::string> items;
        std::istringstream in(c.want.empty() ? "" : rytest::read_file(file));
        std::smatch m;
        for (std::string line; std::getline(in, line);) {
            ASSERT_TRUE(std::regex_match(line, m, record)) << line;
            items[*ids.insert(static_cast<unsigned>(std::stoul(m[1].str())))] = m[2];
        }
        EXPECT_EQ(ids, c.want) << levels;
        if (scenario + levels != "pointsall=8") continue;
        EXPECT_EQ(items[11], R"( "/etc/a\"cl" "" 7/0x7)");  // texts quoted, numbers in decimal and hex
        EXPECT_EQ(items[14], " 0/0x0 7/0x7");                // success: code and result
        EXPECT_EQ(items[26], " 43/0x2b");                    // failure: the code only
        EXPECT_TRUE(std::regex_match(items[99], std::regex(" x:(78){33}"))) << items[99];  // the whole area, no more
    }
}

}  // namespace
