// The error slot is per thread: what one thread records, copies and
// restores never shows in another, also while many do so at once.
#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>
#include <vector>

#include "ry_zo.h"
#include "ryacl_error.h"
#include "ryacl_test_support.h"

TEST(ThreadErrorSlot, EachThreadSeesOnlyItsOwnError) {
    acl::set_error(4, 147);
    std::atomic<int> bad{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 8; ++t) {
        threads.emplace_back([t, &bad] {
            bad += rytest::error_code() != 0;  // a new thread starts clean
            const std::string mine = "/thread/" + std::to_string(t);
            for (int i = 0; i < 2000; ++i) {
                acl::set_error(37, 124, mine.c_str(), i);
                zo_error_t *rec = nullptr;
                zo_get_error_1(&rec);
                zo_set_no_error_1();
                zo_pset_error_1(rec);
                zo_rel_error_1(rec);
                const std::string text = rytest::error_text();
                bad += text.find("file: " + mine + ".\n") == std::string::npos ||
                       text.find("subroutine: " + std::to_string(i) + ".\n") == std::string::npos;
            }
        });
    }
    for (auto &th : threads) th.join();
    EXPECT_EQ(bad.load(), 0);
    EXPECT_EQ(rytest::error_msgnum(), 147);  // the main thread's error is untouched
}
