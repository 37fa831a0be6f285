// The library under threads, tracing: evaluations, listings and file reads while others register
// handlers and rewrite the cache file.  Every result must be right, each thread sees only its errors.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <atomic>
#include <cstring>
#include <ctime>
#include <thread>

#include "lib_acl_bytes.h"
#include "ryacl_acl_file.h"
#include "ryacl_error.h"
#include "ryacl_trace.h"

namespace {

using namespace libtest;
namespace tr = acl::trace;

// Tracing races too; its levels are read at registration, so before main.
rytest::tmp_dir g_dir;
const int g_traced = setenv("RYACL_TRACE", "Errors=1", 1) | setenv("RYACL_TRACE_FILE", (g_dir / "t.log").c_str(), 1);

int32_t h_exact(const char *client, const char *entry) { return std::strcmp(client, entry); }

TEST(Threads, EvaluateListReadWhileRegisteringAndCaching) {
    const std::string file = g_dir / "t.acl";
    rytest::write_file(file, "o r\ng staff rw\ng adm c\nu thr ann w\nu thr bob x\ne thr x/one a\n", 0644);
    struct timespec old[2] = {{time(nullptr) - 100, 0}, {time(nullptr) - 100, 0}};
    utimensat(AT_FDCWD, file.c_str(), old, 0);  // so that the cache is current
    sec_buffer_desc acl{0, nullptr};  // one ACL read by all at once
    uint32_t w = 0, rw = 0, a = 0;
    ASSERT_EQ(sec_read_acl_file(file.c_str(), nullptr, nullptr, SEC_ACLF_FROM_TEXT, &acl, nullptr) |
                  sec_translate_perms("w", nullptr, &w) | sec_translate_perms("rw", nullptr, &rw) |
                  sec_translate_perms("a", nullptr, &a), 0);
    acl::set_error(4, acl::msg::BAD_OPTION);

    std::atomic<bool> stop{false};
    std::atomic<int> failures{0};
    auto check = [&](bool ok) { failures += !ok; };
    std::vector<std::thread> workers, others;
    for (int t = 0; t < 4; ++t) {
        workers.emplace_back([&, t] {
            for (int i = 0; i < 1000; ++i) {
                uint32_t perm = 0;
                // Any case; no user handler is ever registered for "thr": 0x80 changes nothing.
                check(sec__single_acle_perm(&acl, i % 2 ? 0x84 : 4, "thr", nullptr, "ANN", &perm) == 0 &&
                      perm == w && rytest::error_code() == 0);
                check(sec__single_acle_perm(&acl, 4, "thr", nullptr, "zz", &perm) == ACL_RC_BAD_ACLE &&
                      rytest::error_msgnum() == 134);
                sec_buffer_desc g[2] = {{0, const_cast<char *>("nope")}, {0, const_cast<char *>("STAFF")}};
                check(sec__group_acles_perm(&acl, 2, g, &perm) == 0 && perm == rw && rytest::error_code() == 0);
                check(sec__single_acle_perm(&acl, 8, "thr", nullptr, "x/one", &perm) == 0 ? perm == a
                      : rytest::error_msgnum() == 134);  // before or after its handler arrives
                sec_acle_list_desc l{0, nullptr};
                check(sec_list_acl(&acl, &l) == 0 && l.count == 6);
                sec_release_aclelist(&l);
                sec_buffer_desc d{0, nullptr};  // through the cache that is being replaced
                const uint32_t how = t % 2 ? SEC_ACLF_WRITE_CACHE : SEC_ACLF_CONVERT_CACHE;
                check(i % 4 || (sec_read_acl_file(file.c_str(), nullptr, nullptr, how, &d, nullptr) == 0 &&
                                view(d) == view(acl) && rytest::error_code() == 0));
                sec_release_acl(&d);
                tr::point(tr::ERRORS, 115, {tr::val(t), tr::val(i)});
            }
        });
    }
    others.emplace_back([&] {  // a registrar
        check(sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "thr", h_exact) == 0);
        for (int i = 0; i < 500; ++i) {
            const std::string m = "m" + std::to_string(i);
            check(sec__register_id_handler(1 + i % 2, m.c_str(), h_exact) == 0 &&
                  sec__register_id_handler(3, m.c_str(), h_exact) == ACL_RC_BAD_ARGS && rytest::error_msgnum() == 88);
        }
    });
    others.emplace_back([&] {  // a cache writer, replacing the file each time
        for (int32_t r = 0; !stop; r = sec__cache_aclbuffer(file.c_str(), &acl, 1)) check(r == 0 || r == ACL_RC_INFO);
    });
    for (auto &th : workers) th.join();
    stop = true;
    for (auto &th : others) th.join();
    EXPECT_EQ(failures.load(), 0);
    EXPECT_EQ(rytest::error_msgnum(), 147);  // the main thread's error is untouched
    uint32_t perm = 0;  // the registration arrived
    EXPECT_TRUE(sec__single_acle_perm(&acl, 8, "thr", nullptr, "x/one", &perm) == 0 && perm == a);
    sec_release_acl(&acl);
}

}  // namespace
