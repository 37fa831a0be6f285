// The main flows end to end with every allocation they make failing in
// turn: each failure is reported as 6 with message 89 (or passed over where
// the flow says so), leaves the flow's outputs as documented and leaks
// nothing (the sanitizer builds check that).  Each flow prints how many
// allocation sites it reached.
#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <functional>
#include <string>
#include <vector>

#include "ry_zo.h"
#include "ryacl.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_acl_edit.h"
#include "ryacl_acl_entry.h"
#include "ryacl_acl_file.h"
#include "ryacl_acl_tree.h"
#include "ryacl_init.h"
#include "ryacl_utils_codeset.h"
#include "ryacl_test_support.h"
#include "ryacl_utils.h"

namespace {

using bytes = std::vector<unsigned char>;
using strings = std::vector<std::string>;

const char kText[] =
    "n r\n"
    "o rw\n"
    "u unix alice@node1 rw\n"
    "u UNIX bob@node1 r\n"
    "u krb5 carol@REALM x\n"
    "e unix alice rw\n"
    "e unix bob r\n"
    "g staff rlq\n"
    "g admin rwcx\n";

bytes view(const sec_buffer_desc &d) {
    const auto *p = static_cast<const unsigned char *>(d.value);
    return d.length > 0 && p ? bytes(p, p + d.length) : bytes{};
}
sec_buffer_desc own(const bytes &b) {
    sec_buffer_desc d{static_cast<int32_t>(b.size()), std::malloc(b.size())};
    std::memcpy(d.value, b.data(), b.size());
    return d;
}
void drop(sec_buffer_desc &d) {
    std::free(d.value);
    d = {0, nullptr};
}

void expect_no_memory(int32_t rc, long nth, const std::string &what) {
    EXPECT_EQ(rc, ACL_RC_NO_MEMORY) << what << ", allocation " << nth;
    EXPECT_EQ(rytest::error_code(), ACL_RC_NO_MEMORY) << what;
    EXPECT_EQ(rytest::error_msgnum(), 89) << what << ": " << rytest::error_text();
}

// Steps the failure through the flow and reports the sites it reached.
long sweep(const std::string &name, const std::function<int32_t()> &flow,
           const std::function<void(int32_t, long)> &check, const std::function<void()> &reset = {}) {
    long sites = rytest::for_each_alloc_failure(flow, check, reset);
    std::printf("[ alloc    ] %-44s %3ld sites\n", name.c_str(), sites);
    ::testing::Test::RecordProperty(name, static_cast<int>(sites));
    return sites;
}

struct acl_file {
    rytest::tmp_dir dir;
    std::string path = dir / "svc.acl", cache = path + ".cacl";
    acl_file() {
        rytest::write_file(path, kText, 0644);
        struct timespec past[2] = {{time(nullptr) - 100, 0}, {time(nullptr) - 100, 0}};
        utimensat(AT_FDCWD, path.c_str(), past, 0);  // so a cache written now is current
    }
};

// What kText compiles to, by the library's own road with no failure.
bytes compiled_text() {
    acl_file f;
    sec_buffer_desc d{0, nullptr};
    EXPECT_EQ(sec_read_acl_file(f.path.c_str(), nullptr, nullptr, SEC_ACLF_FROM_TEXT, &d, nullptr), 0);
    bytes b = view(d);
    sec_release_acl(&d);
    return b;
}

TEST(AllocFailures, ReadingAFileAndStoringItsCache) {
    acl_file f;
    sec_buffer_desc acl{0, nullptr};
    uint32_t rflags = 0;
    long n = sweep(
        "sec_read_acl_file (text, cache write)",
        [&] { return sec_read_acl_file(f.path.c_str(), nullptr, nullptr, SEC_ACLF_WRITE_CACHE, &acl, &rflags); },
        [&](int32_t rc, long nth) {
            expect_no_memory(rc, nth, "read");
            EXPECT_TRUE(acl.length == 0 && acl.value == nullptr);
            // Nothing was compiled, so nothing was stored, and nothing is left.
            EXPECT_EQ(rytest::list_dir(f.dir.path()), strings{"svc.acl"});
        },
        [&] {
            sec_release_acl(&acl);
            unlink(f.cache.c_str());
        });
    EXPECT_GT(n, 2);
    EXPECT_EQ(rflags & SEC_ACLF_WRITE_CACHE, static_cast<uint32_t>(SEC_ACLF_WRITE_CACHE));
    EXPECT_EQ(view(acl), compiled_text());
    const std::string stored = rytest::read_file(f.cache);
    EXPECT_EQ(bytes(stored.begin(), stored.end()), view(acl));
    sec_release_acl(&acl);
}

// A cache file that cannot be read for want of memory is passed over like
// any unusable cache: the text is compiled instead, if memory allows.
TEST(AllocFailures, ReadingFromTheCacheFallsBackToTheText) {
    acl_file f;
    const bytes want = compiled_text();
    rytest::write_file(f.cache, std::string(want.begin(), want.end()), 0644);
    sec_buffer_desc acl{0, nullptr};
    uint32_t rflags = 0;
    long fallbacks = 0;
    long n = sweep(
        "sec_read_acl_file (cache, convert)",
        [&] { return sec_read_acl_file(f.path.c_str(), nullptr, nullptr, SEC_ACLF_CONVERT_CACHE, &acl, &rflags); },
        [&](int32_t rc, long nth) {
            if (rc == 0) {
                ++fallbacks;
                EXPECT_EQ(rflags & SEC_ACLF_FROM_TEXT, static_cast<uint32_t>(SEC_ACLF_FROM_TEXT)) << nth;
                EXPECT_EQ(rytest::error_code(), 0);
                EXPECT_EQ(view(acl), want) << nth;
            } else {
                expect_no_memory(rc, nth, "read from cache");
                EXPECT_TRUE(acl.length == 0 && acl.value == nullptr);
            }
        },
        [&] { sec_release_acl(&acl); });
    EXPECT_EQ(n, 1);  // the cache road allocates only the buffer it reads into
    EXPECT_EQ(fallbacks, 1);
    EXPECT_EQ(rflags, static_cast<uint32_t>(SEC_ACLF_CONVERT_CACHE));
    EXPECT_EQ(view(acl), want);
    sec_release_acl(&acl);
}

// Every kind of edit on both roads: a failed add leaves every byte as it
// was; a failed delete too, unless only the final shrink failed, which
// leaves the edited ACL in the larger block.
TEST(AllocFailures, EditsLeaveTheAclAsItWasOrDone) {
    const bytes base = compiled_text();
    struct edit {
        const char *what;
        int op;  // 0 add, 1 add2, 2 delete
        unsigned char type;
        const char *mech, *id;
        int32_t rc;  // without failures
    } edits[] = {
        {"add to a user sub-ACL", 0, 4, "unix", "carl@node1", 0},
        {"add a new sub-ACL", 0, 4, "hba2", "dora@node2", 0},
        {"add to the expanded sub-ACL", 0, 8, "unix", "zed", 0},
        {"add a group", 0, 16, "", "ops", 0},
        {"replace a permission", 0, 16, "", "STAFF", 0},
        {"add2 a new user", 1, 4, "krb5", "abe@REALM", 0},
        {"add2 a duplicate", 1, 4, "unix", "ALICE@node1", ACL_RC_BAD_ACLE},
        {"delete a user", 2, 4, "unix", "bob@node1", 0},
        {"delete the last of a sub-ACL", 2, 4, "krb5", "carol@REALM", 0},
        {"delete an expanded entry", 2, 8, "unix", "alice", 0},
        {"delete anyother", 2, 2, "", nullptr, 0},
    };
    for (bool direct : {true, false}) {
        acl__edit_direct_enabled = direct;
        for (const edit &e : edits) {
            const std::string name = std::string(e.what) + (direct ? "" : " (tree road)");
            sec_acle_desc d{};
            d.type = e.type;
            d.perm = 0x5;
            std::strcpy(d.mech, e.mech);
            d.id = const_cast<char *>(e.id);
            auto run = [&](sec_buffer_desc &b) {
                return e.op == 0 ? sec_add_acle_to_acl(&d, &b) : e.op == 1 ? sec_add_acle_to_acl2(&d, &b)
                                                                           : sec_del_acle_from_acl(&d, &b);
            };
            sec_buffer_desc done = own(base);
            const int32_t want_rc = run(done);
            sec_buffer_desc b{0, nullptr};
            sweep(name, [&] { return run(b); },
                  [&](int32_t rc, long nth) {
                      expect_no_memory(rc, nth, name);
                      EXPECT_TRUE(view(b) == base || (e.op == 2 && view(b) == view(done))) << name << " " << nth;
                  },
                  [&] {
                      drop(b);
                      b = own(base);
                  });
            EXPECT_EQ(want_rc, e.rc) << name;
            EXPECT_EQ(view(b), view(done)) << name;
            drop(b);
            drop(done);
        }
    }
    acl__edit_direct_enabled = true;

    // The buffer an add made for itself goes again when the add fails.
    sec_buffer_desc fresh{0, nullptr};
    sec_acle_desc g{};
    g.type = SEC_ACLE_TYPE_GROUP;
    g.id = const_cast<char *>("staff");
    EXPECT_GE(sweep("add to an empty descriptor", [&] { return sec_add_acle_to_acl(&g, &fresh); },
                    [&](int32_t rc, long nth) {
                        expect_no_memory(rc, nth, "add to empty");
                        EXPECT_TRUE(fresh.length == 0 && fresh.value == nullptr);
                    }),
              1);
    sec_release_acl(&fresh);
}

TEST(AllocFailures, ListingsEndEmpty) {
    sec_buffer_desc acl = own(compiled_text());
    struct listing {
        const char *what;
        unsigned char type;  // 0: sec_list_acl
        const char *mech;
    } listings[] = {{"sec_list_acl", 0, nullptr},
                    {"sec_list_acl_by_type (user, every mech)", 4, nullptr},
                    {"sec_list_acl_by_type (user, unix)", 4, "Unix"},
                    {"sec_list_acl_by_type (group)", 16, nullptr}};
    for (const listing &l : listings) {
        sec_acle_list_desc list{0, nullptr};
        long n = sweep(
            l.what,
            [&] { return l.type ? sec_list_acl_by_type(&acl, l.type, l.mech, &list) : sec_list_acl(&acl, &list); },
            [&](int32_t rc, long nth) {
                expect_no_memory(rc, nth, l.what);
                EXPECT_TRUE(list.count == 0 && list.acles == nullptr) << l.what;
            },
            [&] { sec_release_aclelist(&list); });
        EXPECT_GT(n, 1) << l.what;
        EXPECT_GT(list.count, 1) << l.what;
        sec_release_aclelist(&list);
    }
    drop(acl);
}

// A conversion handle is opened once per process; one that could not be
// opened, for want of memory too, is not retried (message 129 for good).
// Seen in a child, before this process opens its own.
TEST(AllocFailures, ConversionHandleThatFailedToOpenStaysAbsent) {
    if (acl__to_utf8_hdl) GTEST_SKIP() << "the handle is already open in this process";
    pid_t pid = fork();
    ASSERT_GE(pid, 0);
    if (pid == 0) {
        sec_acle_t e = nullptr;
        char *out = nullptr;
        size_t inlen = 6, outlen = 0;
        rytest::alloc_fail_nth(1);  // the first allocation of a first conversion is the handle's
        int32_t first = acl__convert_to_utf8("staff", &inlen, &out, &outlen);
        int32_t msg = rytest::error_msgnum();
        rytest::alloc_fail_none();
        int32_t again = sec_create_acle(SEC_ACLE_TYPE_GROUP, 1, nullptr, "staff", &e);
        _exit(first == ACL_RC_CODESET && msg == 129 && again == ACL_RC_CODESET && rytest::error_msgnum() == 129 ? 0 : 1);
    }
    int status = 0;
    ASSERT_EQ(waitpid(pid, &status, 0), pid);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
}

TEST(AllocFailures, EntriesAndConversions) {
    sec_acle_t made = nullptr;
    // Open both conversion handles first: the sweeps are about the
    // conversions' own allocations.
    char *m0 = nullptr, *i0 = nullptr;
    ASSERT_EQ(sec_create_acle(SEC_ACLE_TYPE_USER, 1, "unix", "x@y", &made), 0);
    ASSERT_EQ(sec_display_acle_id(made, &m0, &i0), 0);
    std::free(m0);
    std::free(i0);
    sec_release_acle(made);
    made = nullptr;
    auto release_made = [&] {
        sec_release_acle(made);
        made = nullptr;
    };
    // The "unix" identity with an IPv6 registry name is rewritten first.
    for (const char *id : {"alice@fe80:0:0::1", "alice@node1"}) {
        EXPECT_GT(sweep(std::string("sec_create_acle ") + id,
                        [&] { return sec_create_acle(SEC_ACLE_TYPE_USER, 3, "unix", id, &made); },
                        [&](int32_t rc, long nth) {
                            expect_no_memory(rc, nth, id);
                            EXPECT_EQ(made, nullptr);
                        },
                        release_made),
                  0);
        ASSERT_NE(made, nullptr);
    }
    EXPECT_STREQ(made->id, "alice@node1");

    char *mech = nullptr, *id = nullptr;
    auto release_texts = [&] {
        std::free(mech);
        std::free(id);
        mech = id = nullptr;
    };
    EXPECT_GT(sweep("sec_display_acle_id", [&] { return sec_display_acle_id(made, &mech, &id); },
                    [&](int32_t rc, long nth) {
                        expect_no_memory(rc, nth, "display");
                        EXPECT_TRUE(mech == nullptr && id == nullptr);
                    },
                    release_texts),
              1);
    EXPECT_STREQ(mech, "unix");
    EXPECT_STREQ(id, "alice@node1");
    release_texts();
    release_made();

    const bytes b = compiled_text();
    sec_buffer_desc d{0, nullptr};
    EXPECT_EQ(sweep("sec_read_acl_from_data",
                    [&] { return sec_read_acl_from_data(static_cast<int32_t>(b.size()), b.data(), &d); },
                    [&](int32_t rc, long nth) {
                        expect_no_memory(rc, nth, "from data");
                        EXPECT_TRUE(d.length == 0 && d.value == nullptr);
                    },
                    [&] { sec_release_acl(&d); }),
              1);
    EXPECT_EQ(view(d), b);
    // Conversion and validation work in place and allocate nothing.
    EXPECT_EQ(sweep("sec_convert_acl_to_host", [&] { return sec_convert_acl_to_host(1, &d); },
                    [](int32_t, long) {}),
              0);
    sec_release_acl(&d);

    sec_buffer_desc e{77, nullptr};
    EXPECT_EQ(sweep("sec_create_empty_acl", [&] { return sec_create_empty_acl(&e); },
                    [&](int32_t rc, long nth) {
                        expect_no_memory(rc, nth, "empty");
                        EXPECT_TRUE(e.length == 77 && e.value == nullptr);
                    }),
              1);
    EXPECT_EQ(e.length, 5);
    sec_release_acl(&e);
}

int32_t same_id(const char *a, const char *b) { return std::strcmp(a, b); }

// Registrations grow the registry by doubling: a failed growth registers
// nothing and loses none of the handlers registered before.
TEST(AllocFailures, HandlerRegistration) {
    long total = 0;
    strings mechs;
    for (int k = 0; k < 40; ++k) {
        const std::string mech = "alloc" + std::to_string(k);
        total += rytest::for_each_alloc_failure(
            [&] { return sec__register_id_handler(SEC_ID_HANDLER_USER, mech.c_str(), same_id); },
            [&](int32_t rc, long nth) {
                expect_no_memory(rc, nth, mech);
                sec_acl_id_handler h = nullptr;
                sec__get_id_handler(SEC_ID_HANDLER_USER, mech.c_str(), &h);
                EXPECT_EQ(h, nullptr) << mech;
            });
        mechs.push_back(mech);
        for (const std::string &m : mechs) {
            sec_acl_id_handler h = nullptr;
            sec__get_id_handler(SEC_ID_HANDLER_USER, m.c_str(), &h);
            EXPECT_EQ(h, &same_id) << m;
        }
    }
    std::printf("[ alloc    ] %-44s %3ld sites\n", "sec__register_id_handler (40 registrations)", total);
    ::testing::Test::RecordProperty("sec__register_id_handler", static_cast<int>(total));
    EXPECT_GE(total, 5);  // at least the doublings up to 64 slots
}

// The checker's road through the internal operations: read whole, parse,
// trees, compile, store the cache with force.
int32_t check_and_cache(const std::string &path) {
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) return -1;
    char *text = nullptr;
    size_t size = 0;
    int32_t rc = acl__read_acl_file(path.c_str(), fd, &text, &size);
    close(fd);
    if (rc) return rc;
    acl__trees_s trees;
    char *cursor = text;
    size_t left = size + 1;
    int32_t lineno = 1;
    for (;;) {
        sec_acle_desc e{};
        rc = sec__read_acle_from_text(nullptr, &cursor, &left, &lineno, &e);
        if (rc != 1) break;
        if (e.type && (rc = sec__add_acle_to_trees(&e, &trees)) != 0) break;
    }
    sec_acl_buffer_desc compiled{0, nullptr};
    if (rc == 0) rc = sec__acltrees_to_acl(&trees, &compiled);
    if (rc == 0) rc = sec__cache_aclbuffer(path.c_str(), &compiled, 1);
    acl__free_trees(&trees);
    std::free(compiled.value);
    std::free(text);
    return rc;
}

TEST(AllocFailures, CheckerFlowStoresNothingOnFailure) {
    acl_file f;
    long n = sweep(
        "check: read, parse, trees, compile, cache", [&] { return check_and_cache(f.path); },
        [&](int32_t rc, long nth) {
            expect_no_memory(rc, nth, "check");
            EXPECT_EQ(rytest::list_dir(f.dir.path()), strings{"svc.acl"});
        },
        [&] { unlink(f.cache.c_str()); });
    EXPECT_GT(n, 3);
    const std::string stored = rytest::read_file(f.cache);
    EXPECT_EQ(bytes(stored.begin(), stored.end()), compiled_text());
}

}  // namespace
