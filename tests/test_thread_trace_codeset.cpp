// Many threads converting and tracing at once: the first trace point and
// the first conversion in each direction race to run the once-controls,
// conversions share one handle per direction, and every record is one line.
#include <gtest/gtest.h>

#include <cctype>
#include <cstdlib>
#include <cstring>
#include <latch>
#include <map>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "ryacl_test_support.h"
#include "ryacl_trace.h"
#include "ryacl_utils.h"

namespace {

namespace tr = acl::trace;

// Levels are read at registration, so they are set before main runs.
rytest::tmp_dir g_dir;
const std::string g_file = [] {
    std::string f = g_dir / "trace.log";
    setenv("RYACL_TRACE", "API=8,Errors=1,Perf=2", 1);
    setenv("RYACL_TRACE_FILE", f.c_str(), 1);
    unsetenv("RYACL_UTF8_ASSUMED");
    return f;
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

constexpr int kThreads = 8;
constexpr int kRounds = 300;

TEST(ThreadTraceCodeset, ConcurrentConversionsAndTracePointsStayCorrectAndWhole) {
    std::latch start(kThreads);
    std::vector<int> failures(kThreads, 0);
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t] {
            start.arrive_and_wait();
            int &bad = failures[t];
            for (int i = 0; i < kRounds; ++i) {
                const std::string text = "user" + std::to_string(t) + "_" + std::to_string(i);
                int32_t id = t, round = i;
                tr::point(tr::ERRORS, 115, {tr::val(id), tr::val(round)});
                tr::perf_timer timer(2);
                size_t inlen = text.size() + 1, outlen = 0;
                char *out = nullptr;
                // Alternate directions so both once-controls see a crowd.
                int32_t rc = (i + t) % 2 ? acl__convert_to_utf8(text.c_str(), &inlen, &out, &outlen)
                                         : acl__convert_from_utf8(text.c_str(), &inlen, &out, &outlen);
                bad += rc != 0 || !out || outlen != text.size() + 1 || std::memcmp(out, text.c_str(), outlen) != 0;
                std::free(out);
                timer.record(6, {});

                // An invalid text fails in this thread's slot only.
                out = nullptr, outlen = 0;
                const char invalid[] = "bad\xff";
                inlen = sizeof invalid;
                rc = acl__convert_to_utf8(invalid, &inlen, &out, &outlen);
                bad += rc != 26 || out != nullptr || rytest::error_msgnum() != 130;
                tr::api_exit(13, 13, rc);
            }
        });
    }
    for (auto &th : threads) th.join();
    for (int t = 0; t < kThreads; ++t) EXPECT_EQ(failures[t], 0) << "thread " << t;

    // Every line whole; every point counted; each thread's rounds all there.
    std::istringstream in(rytest::read_file(g_file));
    std::string line, component, items;
    std::map<unsigned, int> per_id;
    std::vector<int> rounds_seen(kThreads, 0);
    while (std::getline(in, line)) {
        unsigned id = 0;
        ASSERT_TRUE(parse_trace_line(line, component, id, items)) << line;
        ASSERT_EQ(component, "_SEL");
        std::vector<unsigned long long> v = numbers(items);
        ASSERT_EQ(v.size(), id == 115 ? 2u : id == 6 ? 3u : 1u) << line;
        ++per_id[id];
        if (id == 115) ++rounds_seen.at(v[0]);
    }
    EXPECT_EQ(per_id[0], 1);  // registration ran once
    EXPECT_EQ(per_id[115], kThreads * kRounds);
    EXPECT_EQ(per_id[6], kThreads * kRounds);
    EXPECT_EQ(per_id[13], kThreads * kRounds);
    for (int t = 0; t < kThreads; ++t) EXPECT_EQ(rounds_seen[t], kRounds) << "thread " << t;
}

}  // namespace
