// The library operations under threads: evaluations, listings and file
// reads run while other threads register handlers and rewrite the cache
// file.  Every result must be right, and no thread's error shows in another.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>

#include <atomic>
#include <cstdio>
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

TEST(Threads, EvaluateListReadWhileRegisteringAndCaching) {
    std::vector<ent> users;
    for (int i = 0; i < 200; ++i) {
        char id[16];
        std::snprintf(id, sizeof id, "user%03d", i);
        users.push_back({static_cast<uint32_t>(i), id});
    }
    sec_buffer_desc shared = own(make_acl({subacl(4, "thr", users), subacl(2, "", {{0x10, ""}}),
                                           subacl(16, "", {{1, "adm"}, {4, "staff"}}),
                                           subacl(8, "thr", {{0x100, "x/one"}})}));  // read by all at once
    rytest::tmp_dir dir;
    const std::string file = dir / "t.acl";
    rytest::write_file(file, "o r\ng staff rw\nu unix ann r\n", 0644);
    struct timespec old[2] = {{time(nullptr) - 100, 0}, {time(nullptr) - 100, 0}};
    utimensat(AT_FDCWD, file.c_str(), old, 0);  // so that the cache is current
    const bytes file_acl =
        make_acl({subacl(4, "unix", {{1, "ann"}}), subacl(16, "", {{3, "staff"}}), subacl(2, "", {{1, ""}})});

    std::atomic<bool> stop{false};
    std::atomic<int> failures{0};
    auto check = [&](bool ok) { failures += !ok; };
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {  // evaluators, each seeing only its own errors
        threads.emplace_back([&, t] {
            for (int i = 0; !stop && i < 4000; ++i) {
                const int u = (i * 7 + t) % 200;
                char id[16];
                std::snprintf(id, sizeof id, "USER%03d", u);
                uint32_t perm = 0;
                // No user handler is ever registered for "thr": 0x80 changes nothing.
                check(sec__single_acle_perm(&shared, i % 2 ? 0x84 : 4, "thr", nullptr, id, &perm) == 0 &&
                      perm == static_cast<uint32_t>(u) && rytest::error_code() == 0);
                check(sec__single_acle_perm(&shared, 4, "thr", nullptr, "zz", &perm) == ACL_RC_BAD_ACLE &&
                      rytest::error_msgnum() == 134);
                sec_buffer_desc g[2] = {{0, const_cast<char *>("nope")}, {0, const_cast<char *>("STAFF")}};
                check(sec__group_acles_perm(&shared, 2, g, &perm) == 0 && perm == 4 && rytest::error_code() == 0);
                check(sec__single_acle_perm(&shared, 8, "thr", nullptr, "x/one", &perm) == 0 ||
                      rytest::error_msgnum() == 134);  // before or after its handler arrives
            }
        });
    }
    threads.emplace_back([&] {  // a lister
        for (int i = 0; !stop && i < 300; ++i) {
            sec_acle_list_desc l{0, nullptr};
            check(sec_list_acl(&shared, &l) == 0 && l.count == 204);
            sec_release_aclelist(&l);
            check(sec_list_acl(nullptr, &l) == ACL_RC_BAD_ARGS && rytest::error_msgnum() == 88);
        }
    });
    for (uint32_t flags : {SEC_ACLF_CONVERT_CACHE, SEC_ACLF_WRITE_CACHE}) {  // readers, through the cache
        threads.emplace_back([&, flags] {
            for (int i = 0; !stop && i < 300; ++i) {
                sec_buffer_desc d{0, nullptr};
                check(sec_read_acl_file(file.c_str(), nullptr, nullptr, flags, &d, nullptr) == 0 &&
                      view(d) == file_acl && rytest::error_code() == 0);
                sec_release_acl(&d);
            }
        });
    }
    threads.emplace_back([&] {  // a registrar
        check(sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "thr", h_exact) == 0);
        for (int i = 0; i < 500; ++i) {
            const std::string m = "m" + std::to_string(i);
            check(sec__register_id_handler(1 + i % 2, m.c_str(), h_exact) == 0);
            check(sec__register_id_handler(3, m.c_str(), h_exact) == ACL_RC_BAD_ARGS && rytest::error_msgnum() == 88);
        }
    });
    threads.emplace_back([&] {  // a cache writer, forced to replace the file each time
        sec_buffer_desc d = own(file_acl);
        for (int i = 0; !stop && i < 200; ++i) {
            int32_t rc = sec__cache_aclbuffer(file.c_str(), &d, 1);
            check(rc == 0 || rc == ACL_RC_INFO);
        }
        drop(d);
    });

    for (size_t i = 4; i < threads.size(); ++i) threads[i].join();
    stop = true;
    for (size_t i = 0; i < 4; ++i) threads[i].join();
    EXPECT_EQ(failures.load(), 0);
    uint32_t perm = 0;  // the registration arrived
    EXPECT_EQ(sec__single_acle_perm(&shared, 8, "thr", nullptr, "x/one", &perm), 0);
    EXPECT_EQ(perm, 0x100u);
    drop(shared);
}

}  // namespace
