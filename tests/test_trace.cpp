// The trace facility and the library's component "_SEL".  Registration
// happens once per process and reads RYACL_TRACE then, so every case that
// registers runs in a fresh copy of this program: a scenario picked by
// RYTEST_TRACE_SCENARIO runs before main and exits.
#include <errno.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <sstream>
#include <string>
#include <vector>

#include "ry_zo_int.h"
#include "ryacl.h"
#include "ryacl_error.h"
#include "ryacl_test_support.h"
#include "ryacl_trace.h"

namespace {

namespace tr = acl::trace;

// Trace points of every kind, with the ids the library uses for them.
int scenario_points() {
    char area[33];
    std::memset(area, 'x', sizeof area);  // no NUL anywhere
    int32_t count = 7;
    tr::api_entry(9, 11, {tr::str("/etc/acl"), tr::str(nullptr), tr::val(count)});
    tr::api_exit(13, 13, 14, 0, {tr::val(count)});    // success with a result
    tr::api_exit(26, 26, 27, 43, {tr::val(count)});   // failure: the code only
    tr::api_exit(43, 43, 6);
    tr::api_release_exit(48);
    tr::api_entry(97, 99, {tr::strn(area, sizeof area)});
    tr::point(tr::ERRORS, 115, {tr::val(count), tr::val(count)});
    tr::point(tr::INFO, 107, {tr::str("cache")});
    tr::point(tr::INFO, 114, {tr::val(count)});
    tr::point(tr::INFO, 104, {});
    tr::perf_timer t1(1), t2(2);
    t1.record(1, {tr::str("/etc/acl")});
    t2.record(6, {});
    char name[257];
    int32_t size = -1;
    std::printf("name=%s\n", tr_get_filename_1(name) == 0 ? name : "?");
    std::printf("size=%d\n", tr_get_size_1(&size) == 0 ? size : -1);
    return 0;
}

// Registration while the thread's slot holds an error (or, with
// `empty`, none) and errno is set: both must come out unchanged.
int scenario_slot(bool empty) {
    int failures = 0;
    if (!empty) acl::set_error(42, 97, "security/ACL/lib/ryacl_acl", 321);
    const std::string before = rytest::error_text();
    errno = EDOM;  // reading the error text may have changed it
    tr::point(tr::ERRORS, 115, {tr::str("x")});  // the first trace point registers
    tr::api_exit(13, 13, 42);
    failures += errno != EDOM;
    if (empty) failures += rytest::error_code() != 0;
    else failures += rytest::error_code() != 42 || rytest::error_msgnum() != 97 || rytest::error_text() != before;
    return failures;
}

// The facility on its own, with a component of the test's.
int scenario_facility() {
    tr_category_description_t cats[4] = {
        {0, "Alpha", 0, 0}, {1, "Beta", 5, 0}, {2, "Gamma", 0, 4}, {3, "Delta", 2, 0}};
    tr_detail_level_t levels[4] = {9, 9, 9, 9};
    if (tr_register_component_1("_TST", levels, cats, 4) != 0) return 1;
    std::printf("levels=%u,%u,%u,%u\n", levels[0], levels[1], levels[2], levels[3]);
    // More items than a record keeps.
    uint32_t v = 5;
    tr_item_t many[40];
    for (auto &i : many) i = tr_item_t{&v, sizeof v};
    tr_record_datav_1("_TST", 500, 40, many);
    tr_record_data_1("_TST", 501, 2, static_cast<const void *>("quo\"te\\"), size_t{8},
                     static_cast<const void *>("\xc3\xa9"), size_t{3});
    unsigned char blob[100];
    for (size_t i = 0; i < sizeof blob; ++i) blob[i] = static_cast<unsigned char>(i);
    tr_record_data_1("_TST", 502, 1, static_cast<const void *>(blob), sizeof blob);
    std::string big(20000, 'b');
    tr_record_data_1("_TST", 503, 1, static_cast<const void *>(big.c_str()), big.size() + 1);
    std::printf("unregister=%d\n", tr_unregister_component_1("_TST"));
    std::printf("after=%d\n", tr_record_id_1("_TST", 504));
    std::printf("unknown=%d\n", tr_record_id_1("_NOPE", 505));
    std::printf("public=%d\n", acl__trace_unregister_component());  // "_SEL" never registered here
    return 0;
}

const int g_scenario = [] {
    const char *s = std::getenv("RYTEST_TRACE_SCENARIO");
    if (!s) return 0;
    int rc = 99;
    if (std::strcmp(s, "points") == 0) rc = scenario_points();
    if (std::strcmp(s, "slot") == 0) rc = scenario_slot(false);
    if (std::strcmp(s, "noslot") == 0) rc = scenario_slot(true);
    if (std::strcmp(s, "facility") == 0) rc = scenario_facility();
    std::fflush(stdout);
    std::_Exit(rc);
}();

// Split one trace line "<time>Z pid=<n> tid=<n> <component> <id><items>"
// after checking its shape; false when the line is not whole.
bool parse_trace_line(const std::string &line, std::string &component, unsigned &id, std::string &items) {
    const char pattern[] = "dddd-dd-ddTdd:dd:dd.ddddddZ";
    const size_t n = sizeof pattern - 1;
    if (line.size() < n) return false;
    for (size_t i = 0; i < n; ++i) {
        bool ok = pattern[i] == 'd' ? std::isdigit(static_cast<unsigned char>(line[i])) != 0 : line[i] == pattern[i];
        if (!ok) return false;
    }
    std::istringstream in(line.substr(n));
    std::string pid, tid, idtext;
    if (!(in >> pid >> tid >> component >> idtext)) return false;
    auto numeric = [](const std::string &s, size_t from) {
        return s.size() > from && s.find_first_not_of("0123456789", from) == std::string::npos;
    };
    if (pid.rfind("pid=", 0) != 0 || !numeric(pid, 4) || tid.rfind("tid=", 0) != 0 || !numeric(tid, 4) ||
        !numeric(idtext, 0))
        return false;
    id = static_cast<unsigned>(std::stoul(idtext));
    std::getline(in, items);
    return true;
}

// The numbers of items written as "<decimal>/0x<hex>", checking that both
// spell the same value.
std::vector<unsigned long long> numbers(const std::string &items) {
    std::vector<unsigned long long> v;
    std::istringstream in(items);
    std::string tok;
    while (in >> tok) {
        size_t slash = tok.find("/0x");
        if (slash == std::string::npos) return {};
        unsigned long long d = std::stoull(tok.substr(0, slash)), h = std::stoull(tok.substr(slash + 3), nullptr, 16);
        if (d != h) return {};
        v.push_back(d);
    }
    return v;
}

struct record {
    unsigned id;
    std::string items;  // everything after the id
};

// Run a scenario in a fresh process; return its records, checking that
// every line has the documented shape.
std::vector<record> run_scenario(const std::string &scenario, const std::string &levels,
                                 const std::string &file, rytest::run_result *res = nullptr) {
    rytest::run_result r = rytest::run({"/proc/self/exe"}, "",
                                       {"RYTEST_TRACE_SCENARIO=" + scenario, "RYACL_TRACE=" + levels,
                                        "RYACL_TRACE_FILE=" + file});
    EXPECT_EQ(r.status, 0) << scenario << " " << levels << "\n" << r.err;
    if (res) *res = r;
    std::vector<record> recs;
    if (!rytest::file_exists(file)) return recs;
    std::istringstream in(rytest::read_file(file));
    std::string line, component, items;
    unsigned id = 0;
    while (std::getline(in, line)) {
        bool whole = parse_trace_line(line, component, id, items);
        EXPECT_TRUE(whole) << line;
        EXPECT_TRUE(component == "_SEL" || component == "_TST") << line;
        if (whole) recs.push_back({id, items});
    }
    return recs;
}

std::map<unsigned, std::string> by_id(const std::vector<record> &recs) {
    std::map<unsigned, std::string> m;
    for (const auto &r : recs) {
        EXPECT_EQ(m.count(r.id), 0u) << "id " << r.id << " recorded twice";
        m[r.id] = r.items;
    }
    return m;
}

std::vector<unsigned> ids(const std::map<unsigned, std::string> &m) {
    std::vector<unsigned> v;
    for (const auto &e : m) v.push_back(e.first);
    return v;
}

TEST(Trace, AllLevelsZeroCreateNoFile) {
    rytest::tmp_dir d;
    rytest::run_result r;
    EXPECT_TRUE(run_scenario("points", "", d / "t.log", &r).empty());
    EXPECT_FALSE(rytest::file_exists(d / "t.log"));
    EXPECT_NE(r.out.find("size=0\n"), std::string::npos) << r.out;
    // Levels named but zero, and unknown categories, are the same as none.
    EXPECT_TRUE(run_scenario("points", "API=0,all=0,Bogus=9", d / "t.log").empty());
    EXPECT_FALSE(rytest::file_exists(d / "t.log"));
}

TEST(Trace, LevelOneRecordsEntryAndExitIdsOnly) {
    rytest::tmp_dir d;
    rytest::run_result r;
    auto m = by_id(run_scenario("points", "api=1,ERRORS=1,Info=1", d / "t.log", &r));
    EXPECT_EQ(ids(m), (std::vector<unsigned>{9, 13, 26, 43, 48, 97, 104, 107, 115}));
    EXPECT_EQ(m[9], "");  // ids carry no data at level 1
    EXPECT_EQ(m[115], " 7/0x7 7/0x7");
    EXPECT_EQ(m[107], " \"cache\"");
    EXPECT_NE(r.out.find("name=" + (d / "t.log") + "\n"), std::string::npos) << r.out;
    // The size is what this process wrote: the whole file.
    EXPECT_NE(r.out.find("size=" + std::to_string(rytest::read_file(d / "t.log").size()) + "\n"),
              std::string::npos) << r.out;
}

TEST(Trace, LevelEightRecordsDataPointsAndTheBulkyInfoPoint) {
    rytest::tmp_dir d;
    auto m = by_id(run_scenario("points", "all=8", d / "t.log"));
    // Data ids instead of entry/exit ids; release exit at any level; 107
    // only at Info 1, 114 only above 7; Perf 8 records point 0 but arms no
    // timer of level 1 or 2.
    EXPECT_EQ(ids(m), (std::vector<unsigned>{0, 11, 14, 26, 43, 48, 99, 104, 114, 115}));
    EXPECT_EQ(m[0], " 8/0x8");
    EXPECT_EQ(m[11], " \"/etc/acl\" \"\" 7/0x7");
    EXPECT_EQ(m[14], " 0/0x0 7/0x7");  // success: code and result
    EXPECT_EQ(m[26], " 43/0x2b");      // failure: the code only
    EXPECT_EQ(m[43], " 6/0x6");
    // The unterminated 33-byte area is shown as its 33 raw bytes, no more.
    std::string hex;
    for (int i = 0; i < 33; ++i) hex += "78";
    EXPECT_EQ(m[99], " x:" + hex);
}

TEST(Trace, PerfLevelsArmTheirOwnTimersAndCasesAndClampingApply) {
    rytest::tmp_dir d;
    auto m = by_id(run_scenario("points", "perf=2,API=3,bogus=4,Errors=x,=5,Info", d / "t.log"));
    EXPECT_EQ(ids(m), (std::vector<unsigned>{0, 6, 48}));
    EXPECT_EQ(m[0], " 2/0x2");
    // Ticks, seconds, nanoseconds: three 64-bit numbers, nanoseconds < 1e9.
    std::vector<unsigned long long> t = numbers(m[6]);
    ASSERT_EQ(t.size(), 3u) << m[6];
    EXPECT_LT(t[2], 1000000000ull);
    EXPECT_EQ(t[0], t[1] * 1000000000ull + t[2]);  // nanosecond ticks: the same span

    m = by_id(run_scenario("points", "Perf=1,API=300", d / "t2.log"));
    EXPECT_EQ(ids(m), (std::vector<unsigned>{0, 1, 11, 14, 26, 43, 48, 99}));  // 300 clamps to 255
    EXPECT_EQ(m[1].rfind(" \"/etc/acl\" ", 0), 0u) << m[1];
}

TEST(Trace, RegistrationKeepsTheCallersErrorAndErrno) {
    rytest::tmp_dir d;
    for (const char *s : {"slot", "noslot"}) {
        run_scenario(s, "", d / "t.log");
        run_scenario(s, "all=8", d / "t.log");  // registration records point 0 here
    }
    EXPECT_TRUE(rytest::file_exists(d / "t.log"));
}

TEST(Trace, FacilityLevelsItemsAndUnregistration) {
    rytest::tmp_dir d;
    rytest::run_result r;
    auto recs = run_scenario("facility", "beta=999,ALPHA=3,gamma=1,delta=x,alpha=4", d / "t.log", &r);
    // Later entries win, 999 clamps, a minimum raises, malformed is ignored.
    EXPECT_NE(r.out.find("levels=4,255,4,2\n"), std::string::npos) << r.out;
    EXPECT_NE(r.out.find("unregister=0\nafter=3\nunknown=3\npublic=3\n"), std::string::npos) << r.out;
    auto m = by_id(recs);
    EXPECT_EQ(ids(m), (std::vector<unsigned>{500, 501, 502, 503}));
    std::string thirty_two;
    for (int i = 0; i < 32; ++i) thirty_two += " 5/0x5";
    EXPECT_EQ(m[500], thirty_two + " (+8 items)");
    EXPECT_EQ(m[501], R"( "quo\"te\\" "\xc3\xa9")");
    std::string hex;
    for (int i = 0; i < 64; ++i) hex += "0123456789abcdef"[i >> 4], hex += "0123456789abcdef"[i & 15];
    EXPECT_EQ(m[502], " x:" + hex + "...(100 bytes)");
    EXPECT_EQ(m[503], " \"" + std::string(1024, 'b') + "\"...");
}

TEST(Trace, ElapsedTimeBorrowsASecondForNegativeNanoseconds) {
    int64_t s = 0, ns = 0;
    tr::elapsed(3, 900000000, 5, 100000000, &s, &ns);
    EXPECT_EQ(s, 1);
    EXPECT_EQ(ns, 200000000);
    tr::elapsed(3, 100, 5, 900, &s, &ns);
    EXPECT_EQ(s, 2);
    EXPECT_EQ(ns, 800);
    tr::elapsed(7, 999999999, 8, 0, &s, &ns);
    EXPECT_EQ(s, 0);
    EXPECT_EQ(ns, 1);
}

TEST(Trace, BoundedTextStopsAtItsNulOrItsArea) {
    char area[33];
    std::memset(area, 'y', sizeof area);
    tr::item i = tr::strn(area, sizeof area);
    EXPECT_EQ(i.n, 33u);
    area[4] = '\0';
    EXPECT_EQ(tr::strn(area, sizeof area).n, 5u);
    EXPECT_STREQ(static_cast<const char *>(tr::strn(nullptr, 33, "<nil>").p), "<nil>");
    EXPECT_STREQ(static_cast<const char *>(tr::str(nullptr, "<nil>").p), "<nil>");
    EXPECT_EQ(tr::str(nullptr).n, 1u);
}

}  // namespace
