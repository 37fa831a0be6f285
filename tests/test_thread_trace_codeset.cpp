// Many threads converting and tracing at once: the first trace point and
// the first conversion in each direction race to run the once-controls,
// conversions share one handle per direction, and every record is one line.
#include <gtest/gtest.h>

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
    setenv("RYACL_TRACE", "API=8,Errors=1,Perf=8", 1);
    setenv("RYACL_TRACE_FILE", f.c_str(), 1);
    unsetenv("RYACL_UTF8_ASSUMED");
    return f;
}();

TEST(ThreadTraceCodeset, ConcurrentConversionsAndTracePointsStayCorrectAndWhole) {
    constexpr int kThreads = 8, kRounds = 300;
    std::latch start(kThreads);
    std::vector<int> failures(kThreads, 0);
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t] {
            start.arrive_and_wait();
            for (int32_t i = 0; i < kRounds; ++i) {
                const std::string text = "user" + std::to_string(t) + "_" + std::to_string(i);
                tr::point(tr::ERRORS, 115, {tr::val(t), tr::val(i)});
                size_t inlen = text.size() + 1, outlen = 0;
                char *out = nullptr;
                // Alternate directions so both once-controls see a crowd.
                int32_t rc = (i + t) % 2 ? acl__convert_to_utf8(text.c_str(), &inlen, &out, &outlen)
                                         : acl__convert_from_utf8(text.c_str(), &inlen, &out, &outlen);
                failures[t] += rc != 0 || !out || outlen != inlen || std::memcmp(out, text.c_str(), inlen) != 0;
                std::free(out);
                out = nullptr, outlen = 0, inlen = 5;  // an invalid text fails in this thread's slot
                rc = acl__convert_to_utf8("bad\xff", &inlen, &out, &outlen);
                failures[t] += rc != 26 || out || rytest::error_msgnum() != 130;
                tr::api_exit(13, 13, rc);
            }
        });
    }
    for (auto &th : threads) th.join();
    for (int t = 0; t < kThreads; ++t) EXPECT_EQ(failures[t], 0) << "thread " << t;

    // Interleaved writes would break lines apart or run two together: every
    // line must hold exactly the numbers its point carries.
    std::istringstream in(rytest::read_file(g_file));
    std::map<unsigned, int> per_id;
    for (std::string line; std::getline(in, line);) {
        std::istringstream f(line);
        std::string when, pid, tid, component, item;
        unsigned id = 0, items = 0;
        ASSERT_TRUE(f >> when >> pid >> tid >> component >> id && component == "_SEL") << line;
        for (; f >> item; ++items) (void)std::stoull(item);  // "<decimal>/0x<hex>"
        ASSERT_EQ(items, id == 115 ? 2u : 1u) << line;
        ++per_id[id];
    }
    EXPECT_EQ(per_id[0], 1);  // registration ran once
    EXPECT_EQ(per_id[115], kThreads * kRounds);
    EXPECT_EQ(per_id[13], kThreads * kRounds);
}

}  // namespace
