// Readers of an ACL file that a configuration tool keeps replacing (a new
// version renamed over the name) and chmodding: each read gets one version
// whole, never an error.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <set>
#include <thread>

#include "aclfck.h"
#include "lib_acl_bytes.h"

namespace {

using namespace libtest;

struct count_sink final : acl__text_sink {
    int faults = 0;
    void fault(int32_t, int32_t) override { ++faults; }
};

TEST(ThreadRename, ReadersGetTheOldOrTheNewFileWholeNeverAnError) {
    rytest::tmp_dir dir;
    const std::string path = dir / "svc.acl", v1 = dir / "v1", v2 = dir / "v2", tmp = dir / "new";
    rytest::write_file(v1, "o r\nu unix alice rw\ng staff r\n");
    rytest::write_file(v2, "n r\nu unix bob rwx\nu unix carol r\ng staff rw\ng ops c\n");
    std::set<bytes> versions;
    for (const std::string &v : {v1, v2}) {
        sec_buffer_desc d{0, nullptr};
        ASSERT_EQ(sec_read_acl_file(v.c_str(), nullptr, nullptr, SEC_ACLF_FROM_TEXT, &d, nullptr), 0);
        versions.insert(view(d));
        sec_release_acl(&d);
    }
    ASSERT_EQ(link(v1.c_str(), path.c_str()), 0);

    std::atomic<bool> stop{false};
    std::atomic<long> swaps{0};
    std::thread tool([&] {
        for (long i = 0; !stop.load(std::memory_order_relaxed); ++i) {
            const std::string &next = i % 2 ? v1 : v2;
            // A new file under a temporary name, renamed over the old one.
            if (link(next.c_str(), tmp.c_str()) != 0 || rename(tmp.c_str(), path.c_str()) != 0) break;
            (void)chmod(path.c_str(), i % 4 < 2 ? 0640 : 0644);
            swaps.fetch_add(1, std::memory_order_relaxed);
            usleep(50);
        }
    });
    int failures = 0, wrong = 0, checker_faults = 0;
    for (int i = 0; i < 20000; ++i) {
        sec_buffer_desc d{0, nullptr};
        if (sec_read_acl_file(path.c_str(), nullptr, nullptr, SEC_ACLF_FROM_TEXT, &d, nullptr) != 0) {
            ++failures;
            continue;
        }
        wrong += versions.count(view(d)) == 0;
        sec_release_acl(&d);
        if (i % 10 == 0) {  // the checker's road, as ryaclfck and `ryacl check` take it
            count_sink sink;
            checker_faults += aclfck__check(path.c_str(), nullptr, ACLFCK_CONTINUE, sink) != 0 || sink.faults;
        }
    }
    stop = true;
    tool.join();
    EXPECT_GT(swaps.load(), 100);  // the race was run
    EXPECT_EQ(failures, 0);
    EXPECT_EQ(wrong, 0);
    EXPECT_EQ(checker_faults, 0);
}

}  // namespace
