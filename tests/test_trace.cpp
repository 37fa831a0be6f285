// The trace facility and the library's component "_SEL".  Registration
// happens once per process and reads RYACL_TRACE then, so every case that
// registers runs in a fresh copy of this program: a scenario picked by
// RYTEST_TRACE_SCENARIO runs before main and exits.
#include <errno.h>
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <sstream>
#include <string>
#include <vector>

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
    tr::api_entry(9, 11, {tr::str("/etc/a\"cl"), tr::str(nullptr), tr::val(count)});
    tr::api_exit(13, 13, 14, 0, {tr::val(count)});   // success with a result
    tr::api_exit(26, 26, 27, 43, {tr::val(count)});  // failure: the code only
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
    acl__trace_unregister_component();
    tr::point(tr::ERRORS, 108, {});  // after unregistration: not recorded
    return 0;
}

// Registration while the thread's slot holds an error (or, with `empty`,
// none) and errno is set: both must come out unchanged.
int scenario_slot(bool empty) {
    if (!empty) acl::set_error(42, 97, "security/ACL/lib/ryacl_acl", 321);
    const std::string before = rytest::error_text();
    errno = EDOM;  // reading the error text may have changed it
    tr::point(tr::ERRORS, 115, {tr::str("x")});  // the first trace point registers
    tr::api_exit(13, 13, 42);
    return errno != EDOM || rytest::error_text() != before || rytest::error_code() != (empty ? 0 : 42);
}

const int g_scenario = [] {
    const char *s = std::getenv("RYTEST_TRACE_SCENARIO");
    if (!s) return 0;
    int rc = std::strcmp(s, "points") == 0 ? scenario_points() : scenario_slot(std::strcmp(s, "noslot") == 0);
    std::_Exit(rc);
}();

// Run a scenario in a fresh process: the ids recorded (each once), with the
// items after the id, every line shaped "<time>Z pid=N tid=N _SEL <id>...".
std::map<unsigned, std::string> run_scenario(const std::string &scenario, const std::string &levels,
                                             const std::string &file) {
    rytest::run_result r = rytest::run({"/proc/self/exe"}, "",
                                       {"RYTEST_TRACE_SCENARIO=" + scenario, "RYACL_TRACE=" + levels,
                                        "RYACL_TRACE_FILE=" + file});
    EXPECT_EQ(r.status, 0) << scenario << " " << levels << "\n" << r.err;
    std::map<unsigned, std::string> m;
    std::istringstream in(rytest::file_exists(file) ? rytest::read_file(file) : "");
    for (std::string line; std::getline(in, line);) {
        std::istringstream f(line);
        std::string when, pid, tid, component, items;
        unsigned id = 0;
        EXPECT_TRUE(f >> when >> pid >> tid >> component >> id && when.size() == 27 && when[26] == 'Z' &&
                    pid.rfind("pid=", 0) == 0 && tid.rfind("tid=", 0) == 0 && component == "_SEL")
            << line;
        std::getline(f, items);
        EXPECT_TRUE(m.emplace(id, items).second) << "recorded twice: " << line;
    }
    return m;
}

std::vector<unsigned> ids(const std::map<unsigned, std::string> &m) {
    std::vector<unsigned> v;
    for (const auto &e : m) v.push_back(e.first);
    return v;
}

TEST(Trace, LevelsSelectThePointsRecorded) {
    rytest::tmp_dir d;
    struct { const char *levels; std::vector<unsigned> want; } cases[] = {
        {"", {}},
        {"API=0,all=0,Bogus=9", {}},
        // Level 1: entry and exit ids; Info 107 only at 1.
        {"api=1,ERRORS=1,Info=1", {9, 13, 26, 43, 48, 97, 104, 107, 115}},
        // Level 8: data points instead; Info 114 only above 7; Perf 8 records
        // point 0 but arms no timer of level 1 or 2.
        {"all=8", {0, 11, 14, 26, 43, 48, 99, 104, 114, 115}},
        // Release exits at any API level; malformed entries ignored.
        {"perf=2,API=3,bogus=4,Errors=x,=5,Info", {0, 6, 48}},
        {"Perf=1,API=300", {0, 1, 11, 14, 26, 43, 48, 99}},  // 300 counts as 255
    };
    std::string hex;
    for (int i = 0; i < 33; ++i) hex += "78";
    int n = 0;
    for (const auto &c : cases) {
        const std::string file = d / ("t" + std::to_string(n++));
        auto m = run_scenario("points", c.levels, file);
        EXPECT_EQ(ids(m), c.want) << c.levels;
        EXPECT_EQ(rytest::file_exists(file), !c.want.empty()) << c.levels;  // nothing recorded, no file
        if (std::string(c.levels) != "all=8") continue;
        EXPECT_EQ(m[11], R"( "/etc/a\"cl" "" 7/0x7)");  // texts quoted, numbers in decimal and hex
        EXPECT_EQ(m[14], " 0/0x0 7/0x7");                // success: code and result
        EXPECT_EQ(m[26], " 43/0x2b");                    // failure: the code only
        EXPECT_EQ(m[99], " x:" + hex);                   // the unterminated 33-byte area, no byte more
    }
    // Registration keeps the caller's error (or none) and errno.
    for (const std::string s : {"slot", "noslot"}) {
        run_scenario(s, "", d / (s + "0"));
        EXPECT_EQ(ids(run_scenario(s, "all=8", d / (s + "8"))), (std::vector<unsigned>{0, 13, 115}));
    }
}

}  // namespace
