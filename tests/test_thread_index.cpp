// One index evaluated from several threads at once while another thread
// registers handlers: every answer right, each thread's errors its own.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "lib_acl_bytes.h"

namespace {

using namespace libtest;

int32_t h_exact(const char *client, const char *entry) { return std::strcmp(client, entry); }

TEST(Threads, OneIndexManyEvaluatorsWhileHandlersArrive) {
    std::vector<ent> users;
    for (int i = 0; i < 500; ++i) users.push_back({static_cast<uint32_t>(i), "u" + std::to_string(1000 + i)});
    sec_buffer_desc d = own(make_acl({subacl(4, "thr", users), subacl(16, "", {{1, "adm"}, {2, "staff"}}),
                                      subacl(8, "thr", {{4, "x/one"}})}));
    sec_acl_index_t ix = nullptr;
    ASSERT_EQ(sec_create_acl_index(&d, &ix), 0);
    drop(d);

    std::atomic<int> failures{0};
    auto check = [&](bool ok) { failures += !ok; };
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&, t] {
            for (int i = 0; i < 2000; ++i) {
                const int k = (i * 7 + t) % 500;
                const std::string id = "U" + std::to_string(1000 + k);
                uint32_t perm = 0;
                check(sec_index_single_acle_perm(ix, 4, "thr", nullptr, id.c_str(), &perm) == 0 &&
                      perm == static_cast<uint32_t>(k) && rytest::error_msgnum() == 0);
                check(sec_index_single_acle_perm(ix, 4, "thr", nullptr, (id + "x").c_str(), &perm) ==
                          ACL_RC_BAD_ACLE &&
                      rytest::error_msgnum() == 134);
                sec_buffer_desc g[2] = {{0, const_cast<char *>("STAFF")}, {0, const_cast<char *>("adm")}};
                check(sec_index_group_acles_perm(ix, 2, g, &perm) == 0 && perm == 3);
                // Before or after its handler arrives; exact matching then.
                const int32_t rc = sec_index_single_acle_perm(ix, 8, "thr", nullptr, "x/one", &perm);
                check(rc == 0 ? perm == 4 : rytest::error_msgnum() == 134);
                check(sec_index_single_acle_perm(ix, 0x84, "thr", nullptr, id.c_str(), &perm) == 0 ||
                      rytest::error_msgnum() == 134);  // the user handler compares exactly: U is not u
            }
        });
    }
    threads.emplace_back([&] {
        check(sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "thr", h_exact) == 0);
        check(sec__register_id_handler(SEC_ID_HANDLER_USER, "thr", h_exact) == 0);
    });
    for (auto &th : threads) th.join();
    EXPECT_EQ(failures.load(), 0);
    uint32_t perm = 0;
    EXPECT_EQ(sec_index_single_acle_perm(ix, 8, "thr", nullptr, "x/one", &perm), 0);
    EXPECT_EQ(perm, 4u);
    EXPECT_EQ(sec_index_single_acle_perm(ix, 0x84, "thr", nullptr, "U1000", &perm), ACL_RC_BAD_ACLE);
    sec_release_acl_index(ix);
}

}  // namespace
