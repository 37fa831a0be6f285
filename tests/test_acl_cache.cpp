// The cache writer: bytes, identity, freshness, name limit, planted links.
// (Failures at each step, killed writers: test_cache_faults, test_crash_consistency.)
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <functional>
#include <string>
#include <vector>

#include "ry_zo.h"
#include "ryacl_acl_file.h"
#include "ryacl_test_support.h"

namespace {

using strings = std::vector<std::string>;
std::function<void(const std::string &)> g_on_tmp;  // each temporary name tried

struct stat lstat_of(const std::string &p) {
    struct stat st {};
    EXPECT_EQ(lstat(p.c_str(), &st), 0) << p;
    return st;
}

struct AclCache : ::testing::Test {
    rytest::tmp_dir d;
    std::string acl = d / "acl", cache = acl + ".cacl";
    std::string bytes = std::string("\x01\x00\x02", 3) + std::string(297, 'c');
    void SetUp() override { rytest::write_file(acl, "u:unix:joe:rw\n", 0640); }
    void TearDown() override { acl__set_file_step_hook(nullptr); }
    int32_t store(sec_boolean_t force = 1, const std::string &b = "new compiled ACL", const std::string &name = "") {
        sec_acl_buffer_desc desc{static_cast<int32_t>(b.size()), const_cast<char *>(b.data())};
        return sec__cache_aclbuffer((name.empty() ? acl : name).c_str(), &desc, force);
    }
    void expect_failed(int32_t rc, int32_t msg) {
        EXPECT_EQ(rc, 37);
        EXPECT_EQ(rytest::error_msgnum(), msg) << rytest::error_text();
    }
};

TEST_F(AclCache, ExactBytesWithTheAclFilesIdentityOverAMatchingCacheOnly) {
    sec_acl_buffer_desc none{0, nullptr};
    EXPECT_EQ(sec__cache_aclbuffer(acl.c_str(), &none, 1), 1);  // nothing to store, no error
    EXPECT_TRUE(rytest::error_code() == 0 && rytest::list_dir(d.path()) == strings{"acl"});
    rytest::write_file(cache, bytes, 0600);
    expect_failed(store(), 137);  // another mode
    if (geteuid() == 0) {
        ASSERT_EQ(chmod(cache.c_str(), 0640) | chown(cache.c_str(), 65534, 0), 0);
        expect_failed(store(), 136);  // another owner
        ASSERT_EQ(chown(acl.c_str(), 65534, 65534) | chown(cache.c_str(), 65534, 65534), 0);
    }
    EXPECT_EQ(rytest::read_file(cache), bytes);
    ASSERT_EQ(chmod(cache.c_str(), 0640), 0);
    auto set_times = [&](long acl_ns, long cache_ns) {  // nanoseconds after a fixed second
        for (auto [p, ns] : {std::pair{&acl, acl_ns}, {&cache, cache_ns}}) {
            struct timespec t[2] = {{1700000000 + ns / 1000000000, ns % 1000000000}, {}};
            t[1] = t[0];
            ASSERT_EQ(utimensat(AT_FDCWD, p->c_str(), t, 0), 0);
        }
    };
    set_times(900000000, 1000000000);  // cache in the next second: fresh, kept unless forced
    zo_set_no_error_1();
    EXPECT_EQ(store(0), 1);
    EXPECT_EQ(rytest::error_code(), 0);
    EXPECT_EQ(rytest::read_file(cache), bytes);
    EXPECT_EQ(store(1), 0);
    EXPECT_EQ(rytest::read_file(cache), "new compiled ACL");
    set_times(900000000, 100000000);  // same second: not known to be fresh
    EXPECT_EQ(store(0, bytes), 0);
    EXPECT_EQ(rytest::read_file(cache), bytes);
    struct stat a = lstat_of(acl), c = lstat_of(cache);
    EXPECT_TRUE(c.st_uid == a.st_uid && c.st_gid == a.st_gid && c.st_mode == a.st_mode);
    EXPECT_EQ(rytest::list_dir(d.path()), (strings{"acl", "acl.cacl"}));
}

TEST_F(AclCache, NameOf4089FitsAnd4090IsRefused) {
    std::string dir = d.path();
    while (4089 - dir.size() > 200) {
        dir += "/" + std::string(std::min<size_t>(200, 4089 - dir.size() - 150), 'd');
        ASSERT_EQ(mkdir(dir.c_str(), 0700), 0);
    }
    std::string name = dir + "/" + std::string(4089 - dir.size() - 1, 'a');
    rytest::write_file(name, "x");
    EXPECT_EQ(store(1, bytes, name), 0);
    EXPECT_EQ(rytest::read_file(name + ".cacl"), bytes);
    expect_failed(store(1, bytes, name + "a"), 135);
}

TEST_F(AclCache, PlantedLinksAreNeverFollowed) {
    rytest::write_file(d / "victim", "precious", 0600);
    for (const char *target : {"victim", "ghost"}) {  // at the cache name: 138, left alone
        unlink(cache.c_str());
        ASSERT_EQ(symlink((d / target).c_str(), cache.c_str()), 0);
        expect_failed(store(), 138);
        EXPECT_TRUE(S_ISLNK(lstat_of(cache).st_mode));
    }
    unlink(cache.c_str());
    strings tries;  // at the temporary names: skipped, four more hex digits each time
    size_t plant = 2;
    g_on_tmp = [&](const std::string &p) {
        tries.push_back(p);
        if (tries.size() <= plant) { EXPECT_EQ(symlink((d / (tries.size() % 2 ? "victim" : "ghost")).c_str(), p.c_str()), 0); }
    };
    acl__set_file_step_hook([](const char *s, const char *p) { if (std::string(s) == "cache:open-tmp") g_on_tmp(p); });
    ASSERT_EQ(store(), 0);
    ASSERT_EQ(tries.size(), 3u);
    for (size_t i = 0; i < tries.size(); ++i)
        EXPECT_TRUE(tries[i].size() == acl.size() + 5 + 4 * i && tries[i].rfind(i ? tries[i - 1] : acl + ".", 0) == 0 &&
                    tries[i].find_first_not_of("0123456789abcdef", acl.size() + 1) == std::string::npos)
            << tries[i];
    EXPECT_TRUE(rytest::read_file(d / "victim") == "precious" && (lstat_of(d / "victim").st_mode & 07777) == 0600);
    EXPECT_FALSE(rytest::file_exists(d / "ghost"));

    tries.clear();  // every name taken: a bounded number of tries, then 138 naming the last
    plant = 100;
    expect_failed(store(), 138);
    EXPECT_LE(tries.size(), 8u);
    EXPECT_NE(rytest::error_text().find(tries.back()), std::string::npos);
    EXPECT_EQ(rytest::list_dir(d.path()).size(), 5 + tries.size());  // acl, cache, victim, 2+n links

    std::string longacl = d / std::string(250, 'l');  // the second try no longer fits an entry
    rytest::write_file(longacl, "x");
    tries.clear();
    plant = 1;
    expect_failed(store(1, bytes, longacl), 138);
    EXPECT_EQ(tries.size(), 2u);
}

}  // namespace
