// Reading an ACL file into a compiled ACL, with and without its cache file.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <ctime>
#include <string>

#include "lib_acl_bytes.h"
#include "ryacl.h"
#include "ryacl_acl_file.h"
#include "ryacl_test_support.h"

namespace {

using namespace libtest;

const char kText[] = "# sample\no r\nu unix bob rw\nu unix Alice r\n";
// What kText compiles to: sub-ACLs in reverse order of first appearance.
bytes compiled() {
    return make_acl({subacl(4, "unix", {{1, "Alice"}, {3, "bob"}}), subacl(2, "", {{1, ""}})});
}

void set_mtime(const std::string &path, time_t when) {
    struct timespec ts[2] = {{when, 0}, {when, 0}};
    ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), ts, 0), 0) << path;
}

struct fixture {
    rytest::tmp_dir dir;
    std::string acl = dir / "svc.acl";
    std::string cacl = acl + ".cacl";
    time_t now = time(nullptr);

    explicit fixture(const std::string &text = kText) {
        rytest::write_file(acl, text, 0644);
        chmod(acl.c_str(), 0644);
        set_mtime(acl, now - 100);
    }
    // A cache file with the text file's owner, group and mode, newer.
    void cache(const bytes &b, time_t age = 10, mode_t mode = 0644) {
        rytest::write_file(cacl, std::string(b.begin(), b.end()), mode);
        chmod(cacl.c_str(), mode);
        set_mtime(cacl, now - age);
    }
    struct result {
        int32_t rc;
        bytes acl;
        uint32_t rflags;
        bool empty;
    };
    result read(uint32_t flags, const char *user = nullptr) {
        sec_buffer_desc d{-1, reinterpret_cast<void *>(0x1)};
        uint32_t rflags = 0xdead;
        result r{sec_read_acl_file(acl.c_str(), user, nullptr, flags, &d, &rflags), {}, rflags, false};
        r.empty = d.length == 0 && d.value == nullptr;
        if (!r.empty && d.value != reinterpret_cast<void *>(0x1)) {
            r.acl = view(d);
            sec_release_acl(&d);
        }
        return r;
    }
};

TEST(ReadFile, TextOnlyAndWritingTheCache) {
    fixture f;
    auto r = f.read(0);  // no cache file: the text, silently
    ASSERT_EQ(r.rc, 0);
    EXPECT_EQ(r.acl, compiled());
    EXPECT_EQ(r.rflags, SEC_ACLF_FROM_TEXT);
    EXPECT_EQ(rytest::error_code(), 0);
    EXPECT_FALSE(rytest::file_exists(f.cacl));

    r = f.read(SEC_ACLF_WRITE_CACHE | SEC_ACLF_CONVERT_CACHE | 0x100);
    ASSERT_EQ(r.rc, 0);
    EXPECT_EQ(r.rflags, SEC_ACLF_FROM_TEXT | SEC_ACLF_WRITE_CACHE | 0x100);
    ASSERT_TRUE(rytest::file_exists(f.cacl));
    bytes stored;
    for (char c : rytest::read_file(f.cacl)) stored.push_back(static_cast<unsigned char>(c));
    EXPECT_EQ(stored, compiled());

    // The cache now serves, with and without conversion; 0x2 is dropped.
    set_mtime(f.cacl, f.now - 10);
    r = f.read(SEC_ACLF_WRITE_CACHE);
    EXPECT_EQ(r.rc, 0);
    EXPECT_EQ(r.acl, compiled());
    EXPECT_EQ(r.rflags, 0u);
    r = f.read(SEC_ACLF_CONVERT_CACHE);
    EXPECT_EQ(r.acl, compiled());
    EXPECT_EQ(r.rflags, SEC_ACLF_CONVERT_CACHE);
}

TEST(ReadFile, CacheFlagsForEveryPath) {
    // A cache that is told apart from the text by its contents.
    const bytes marker = make_acl({subacl(1, "", {{7, ""}})});
    bytes reversed = marker;  // the same in the other byte order
    reversed[2] = 1;
    std::swap(reversed[3], reversed[4]);
    std::swap(reversed[5], reversed[8]);
    std::swap(reversed[6], reversed[7]);
    std::swap(reversed[10], reversed[13]);
    std::swap(reversed[11], reversed[12]);
    std::swap(reversed[16], reversed[19]);
    std::swap(reversed[17], reversed[18]);

    struct path {
        const char *what;
        uint32_t flags;
        std::function<void(fixture &)> setup;
        bool from_cache;
        uint32_t rflags;
    };
    const path paths[] = {
        {"used", 0, [&](fixture &f) { f.cache(marker); }, true, 0},
        {"used with 0x4", 4, [&](fixture &f) { f.cache(marker); }, true, 4},
        {"reversed, converted", 4, [&](fixture &f) { f.cache(reversed); }, true, 4},
        {"same second is stale", 4, [&](fixture &f) { f.cache(marker, 100); }, false, 1},
        {"older", 0, [&](fixture &f) { f.cache(marker, 200); }, false, 1},
        {"mode differs", 4, [&](fixture &f) { f.cache(marker, 10, 0640); }, false, 1},
        {"owner differs", 4,
         [&](fixture &f) {
             f.cache(marker);
             ASSERT_EQ(chown(f.cacl.c_str(), 4242, static_cast<gid_t>(-1)), 0);
         },
         false, 1},
        {"empty cache", 4, [&](fixture &f) { f.cache({}); }, false, 1},
        {"fails verification", 4, [&](fixture &f) { f.cache({0x85, 1, 2, 1, 0, 9}); }, false, 1},
        {"unverified bytes returned as they are", 0, [&](fixture &f) { f.cache({0x85, 1, 2, 1, 0, 9}); },
         true, 0},
        {"a link is not followed", 0,
         [&](fixture &f) {
             std::string real = f.dir / "elsewhere";
             rytest::write_file(real, std::string(marker.begin(), marker.end()), 0644);
             chmod(real.c_str(), 0644);
             ASSERT_EQ(symlink(real.c_str(), f.cacl.c_str()), 0);
             set_mtime(real, f.now - 10);
         },
         false, 1},
        {"text asked for", 1, [&](fixture &f) { f.cache(marker); }, false, 1},
        {"0x1|0x2 with a newer cache", 3, [&](fixture &f) { f.cache(marker); }, false, 1},
        {"0x2 with a mismatched cache", 2, [&](fixture &f) { f.cache(marker, 10, 0600); }, false, 1},
        {"0x2 with a stale cache", 2, [&](fixture &f) { f.cache(marker, 200); }, false, 3},
    };
    for (const path &p : paths) {
        fixture f;
        p.setup(f);
        const std::string before = rytest::file_exists(f.cacl) ? rytest::read_file(f.cacl) : "";
        auto r = f.read(p.flags);
        ASSERT_EQ(r.rc, 0) << p.what;
        EXPECT_EQ(rytest::error_code(), 0) << p.what;
        EXPECT_EQ(r.rflags, p.rflags) << p.what;
        if (p.from_cache) {
            EXPECT_NE(r.acl, compiled()) << p.what;
            if (p.flags & 4) {
                EXPECT_EQ(r.acl, marker) << p.what;
            }
        } else {
            EXPECT_EQ(r.acl, compiled()) << p.what;
        }
        if (!(p.rflags & SEC_ACLF_WRITE_CACHE) && p.flags & SEC_ACLF_WRITE_CACHE) {
            EXPECT_EQ(rytest::read_file(f.cacl), before) << p.what << ": the cache was rewritten";
        }
    }
}

TEST(ReadFile, CacheReplacedBetweenLookAndOpenIsPassedOver) {
    fixture f;
    f.cache(make_acl({subacl(1, "", {{7, ""}})}));
    static std::string target, swap_in;
    target = f.cacl;
    swap_in = f.dir / "other";
    rytest::write_file(swap_in, std::string(5, '\0'), 0644);
    acl__set_file_step_hook([](const char *step, const char *path) {
        if (std::string(step) == "read:open" && target == path) {
            rename(swap_in.c_str(), target.c_str());
            acl__set_file_step_hook(nullptr);
        }
    });
    auto r = f.read(0);
    acl__set_file_step_hook(nullptr);
    EXPECT_EQ(r.rc, 0);
    EXPECT_EQ(r.rflags, SEC_ACLF_FROM_TEXT);
    EXPECT_EQ(r.acl, compiled());
}

TEST(ReadFile, EmptyFilesCommentsAndFailures) {
    {
        fixture f("");
        f.cache(make_acl({subacl(1, "", {{7, ""}})}));
        auto r = f.read(SEC_ACLF_WRITE_CACHE | 0x40);
        EXPECT_EQ(r.rc, 0);
        EXPECT_TRUE(r.empty);
        EXPECT_EQ(r.rflags, SEC_ACLF_WRITE_CACHE | 0x40u);  // nothing was looked at
    }
    {
        fixture f("# only\n\n   # comments\n");
        auto r = f.read(SEC_ACLF_WRITE_CACHE);
        EXPECT_EQ(r.rc, 0);
        EXPECT_TRUE(r.empty);
        EXPECT_EQ(r.rflags, SEC_ACLF_FROM_TEXT);
        EXPECT_FALSE(rytest::file_exists(f.cacl));
    }
    {
        fixture f("o r\nq bad line\n");
        f.cache({0x85, 1, 2, 1, 0});  // fails verification; the text is parsed
        auto r = f.read(SEC_ACLF_CONVERT_CACHE);
        EXPECT_NE(r.rc, 0);
        EXPECT_EQ(rytest::error_code(), r.rc);
        EXPECT_TRUE(r.empty);
    }
    {
        // The text file vanishes after the cache was refused: the message
        // names the text file.
        fixture f;
        f.cache({0x85, 1, 2, 1, 0});
        static std::string text;
        text = f.acl;
        acl__set_file_step_hook([](const char *step, const char *path) {
            if (std::string(step) == "read:open" && text == path) unlink(path);
        });
        auto r = f.read(SEC_ACLF_CONVERT_CACHE);
        acl__set_file_step_hook(nullptr);
        EXPECT_EQ(r.rc, ACL_RC_FILE_ERROR);
        EXPECT_EQ(rytest::error_msgnum(), 124);
        std::string msg = rytest::error_text();
        EXPECT_NE(msg.find(f.acl + "."), std::string::npos) << msg;
        EXPECT_EQ(msg.find(".cacl"), std::string::npos) << msg;
    }
    {
        fixture f;
        sec_buffer_desc d{3, reinterpret_cast<void *>(0x1)};
        EXPECT_EQ(sec_read_acl_file(nullptr, nullptr, nullptr, 0, nullptr, nullptr), ACL_RC_BAD_ARGS);
        EXPECT_NE(rytest::error_text().find("Positional parameter number: 1"), std::string::npos);
        EXPECT_EQ(sec_read_acl_file(f.acl.c_str(), "", nullptr, 0, nullptr, nullptr), ACL_RC_BAD_ARGS);
        EXPECT_NE(rytest::error_text().find("Positional parameter number: 5"), std::string::npos);
        EXPECT_EQ(sec_read_acl_file(f.acl.c_str(), "", nullptr, 0, &d, nullptr), ACL_RC_BAD_ARGS);
        EXPECT_EQ(rytest::error_msgnum(), 121);
        EXPECT_EQ(d.length, 3);  // refused parameters leave the descriptor
        std::string missing = f.dir / "missing.acl";
        EXPECT_EQ(sec_read_acl_file(missing.c_str(), nullptr, nullptr, 0, &d, nullptr),
                  ACL_RC_FILE_ERROR);
        EXPECT_EQ(rytest::error_msgnum(), 122);
        EXPECT_EQ(d.length, 0);
        EXPECT_EQ(d.value, nullptr);
    }
}

// Each allocation of a read that compiles the text and stores the cache
// fails in turn: a failure is 6 with message 89 and an empty descriptor; a
// failed cache store is silent (0x2 cleared).  Nothing leaks.
TEST(ReadFile, EachAllocationFailure) {
    fixture f;
    sec_buffer_desc d{0, nullptr};
    uint32_t rflags = 0;
    long sites = rytest::for_each_alloc_failure(
        [&] { return sec_read_acl_file(f.acl.c_str(), nullptr, nullptr, SEC_ACLF_WRITE_CACHE, &d, &rflags); },
        [&](int32_t rc, long nth) {
            if (rc == 0) {
                EXPECT_EQ(view(d), compiled()) << nth;
                EXPECT_EQ(rflags & SEC_ACLF_WRITE_CACHE, 0u) << nth;
                EXPECT_EQ(rytest::error_code(), 0);
            } else {
                EXPECT_EQ(rc, ACL_RC_NO_MEMORY) << nth;
                EXPECT_EQ(rytest::error_msgnum(), 89);
                EXPECT_EQ(d.length, 0);
                EXPECT_EQ(d.value, nullptr);
            }
            sec_release_acl(&d);
        },
        [&] { unlink(f.cacl.c_str()); });
    EXPECT_GT(sites, 3);
    EXPECT_EQ(view(d), compiled());
    sec_release_acl(&d);
}

}  // namespace
