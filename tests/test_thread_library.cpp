// The library operations under threads: evaluations, listings and file
// reads run while other threads register handlers and rewrite the cache
// file.  Every result must be right, and no thread's error shows in another.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>

#include <atomic>
#include <cstring>
#include <ctime>
#include <string>
#include <thread>
#include <vector>

#include "lib_acl_bytes.h"
#include "ryacl.h"
#include "ryacl_acl_file.h"
#include "ryacl_test_support.h"

namespace {

using namespace libtest;

int32_t h_exact(const char *client, const char *entry) { return std::strcmp(client, entry); }
int32_t h_never(const char *, const char *) { return 1; }

TEST(Threads, EvaluateListReadWhileRegisteringAndCaching) {
    std::vector<ent> users;
    for (int i = 0; i < 200; ++i) {
        char id[16];
        std::snprintf(id, sizeof id, "user%03d", i);
        users.push_back({static_cast<uint32_t>(i), id});
    }
    const bytes compiled_acl = make_acl({subacl(4, "thr", users), subacl(2, "", {{0x10, ""}}),
                                         subacl(16, "", {{1, "adm"}, {4, "staff"}}),
                                         subacl(8, "thr", {{0x100, "x/one"}})});
    sec_buffer_desc shared = own(compiled_acl);  // read by every thread at once

    rytest::tmp_dir dir;
    const std::string file = dir / "t.acl";
    rytest::write_file(file, "o r\ng staff rw\nu unix ann r\n", 0644);
    chmod(file.c_str(), 0644);
    struct timespec old[2] = {{time(nullptr) - 100, 0}, {time(nullptr) - 100, 0}};
    utimensat(AT_FDCWD, file.c_str(), old, 0);
    const bytes file_acl = make_acl({subacl(4, "unix", {{1, "ann"}}), subacl(16, "", {{3, "staff"}}),
                                     subacl(2, "", {{1, ""}})});

    std::atomic<bool> stop{false};
    std::atomic<int> failures{0};
    auto check = [&](bool ok) {
        if (!ok) ++failures;
    };
    std::vector<std::thread> threads;

    // Evaluators.  Each thread's own error must be the one it sees.
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; !stop && i < 4000; ++i) {
                const int u = (i * 7 + t) % 200;
                char id[16];
                std::snprintf(id, sizeof id, "USER%03d", u);
                uint32_t perm = 0;
                check(sec__single_acle_perm(&shared, 4, "thr", nullptr, id, &perm) == 0 &&
                      perm == static_cast<uint32_t>(u) && rytest::error_code() == 0);
                // No user handler is ever registered for "thr".
                check(sec__single_acle_perm(&shared, 0x84, "thr", nullptr, id, &perm) == 0 &&
                      perm == static_cast<uint32_t>(u));
                check(sec__single_acle_perm(&shared, 4, "thr", nullptr, "zz", &perm) == ACL_RC_BAD_ACLE &&
                      rytest::error_msgnum() == 134);
                sec_buffer_desc g[2] = {{0, const_cast<char *>("nope")}, {0, const_cast<char *>("STAFF")}};
                check(sec__group_acles_perm(&shared, 2, g, &perm) == 0 && perm == 4 &&
                      rytest::error_code() == 0);
                check(sec__single_acle_perm(&shared, 8, "thr", nullptr, "x/one", &perm) == 0 ||
                      rytest::error_msgnum() == 134);
            }
        });
    }
    // Listers.
    threads.emplace_back([&] {
        for (int i = 0; !stop && i < 300; ++i) {
            sec_acle_list_desc l{0, nullptr};
            check(sec_list_acl(&shared, &l) == 0 && l.count == 204);
            sec_release_aclelist(&l);
            check(sec_list_acl_by_type(&shared, 16, nullptr, &l) == 0 && l.count == 2);
            sec_release_aclelist(&l);
            check(sec_list_acl(nullptr, &l) == ACL_RC_BAD_ARGS && rytest::error_msgnum() == 88);
        }
    });
    // Readers of the file, through the cache when it is there.
    for (int t = 0; t < 2; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; !stop && i < 300; ++i) {
                sec_buffer_desc d{0, nullptr};
                uint32_t rflags = 0;
                uint32_t flags = t ? SEC_ACLF_CONVERT_CACHE : SEC_ACLF_WRITE_CACHE;
                check(sec_read_acl_file(file.c_str(), nullptr, nullptr, flags, &d, &rflags) == 0 &&
                      view(d) == file_acl && rytest::error_code() == 0);
                sec_release_acl(&d);
            }
        });
    }
    // Registrars: handlers for the evaluated mechanisms, and many others.
    threads.emplace_back([&] {
        check(sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "thr", h_exact) == 0);
        for (int i = 0; i < 500; ++i) {
            std::string m = "m" + std::to_string(i);
            check(sec__register_id_handler(1 + i % 2, m.c_str(), i % 3 ? h_exact : h_never) == 0);
            check(sec__register_id_handler(3, m.c_str(), h_exact) == ACL_RC_BAD_ARGS &&
                  rytest::error_msgnum() == 88);
        }
    });
    // A cache writer that keeps replacing the cache file.
    threads.emplace_back([&] {
        sec_buffer_desc d = own(file_acl);
        for (int i = 0; !stop && i < 200; ++i) {
            // Forced: rewritten even when current.
            int32_t rc = sec__cache_aclbuffer(file.c_str(), &d, 1);
            check(rc == 0 || rc == ACL_RC_INFO);
        }
        drop(d);
    });

    for (size_t i = 4; i < threads.size(); ++i) threads[i].join();
    stop = true;
    for (size_t i = 0; i < 4; ++i) threads[i].join();
    EXPECT_EQ(failures.load(), 0);

    // Every registration arrived; lookups see them all.
    uint32_t perm = 0;
    EXPECT_EQ(sec__single_acle_perm(&shared, 8, "thr", nullptr, "x/one", &perm), 0);
    EXPECT_EQ(perm, 0x100u);
    drop(shared);
}

}  // namespace
