// Entries, templates and translation between letters and masks.  (Their
// allocation failures: test_alloc_failures.)
#include <gtest/gtest.h>

#include "lib_acl_bytes.h"
#include "ryacl_acl_entry.h"

namespace {

bool error_has(int32_t msg, const std::string &part) {
    return rytest::error_msgnum() == msg && rytest::error_text().find(part) != std::string::npos;
}

TEST(AclTranslate, LettersAndMasksBothWays) {
    const struct { const char *letters; int32_t rc; uint32_t mask; } perms[] = {
        {"xwr", 0, 0xb}, {"rwcxCqledvsao", 0, 0x1fff}, {nullptr, 0, 0}, {"rwz", 36, 0x3}};
    for (const auto &t : perms) {
        uint32_t m = 77;
        EXPECT_TRUE(sec_translate_perms(t.letters, nullptr, &m) == t.rc && m == t.mask) << t.mask;
    }
    EXPECT_TRUE(error_has(133, "('z')"));
    const struct { uint32_t mask; int32_t rc; const char *letters; } masks[] = {
        {0xb, 0, "rwx"}, {0x1fff, 0, "rwcxCqledvsao"}, {0, 0, ""}, {0x80000000u, 36, ""}, {0x2003, 36, ""}};
    for (const auto &t : masks) {
        char out[33] = "junk";
        EXPECT_TRUE(sec_translate_bitmask(t.mask, nullptr, out) == t.rc && (t.rc || std::string(out) == t.letters)) << out;
    }
    EXPECT_TRUE(error_has(164, "(0x00002000)"));
    EXPECT_EQ(sec_translate_perms("r", nullptr, nullptr) + sec_translate_bitmask(1, nullptr, nullptr), 8);
    EXPECT_TRUE(error_has(88, "sec_translate_mask\n\tPositional parameter number: 3"));

    // The first template of a letter or bit wins; a multi-bit one only reads.
    sec_perm_desc t[3] = {{0x3, 'A', "", ""}, {0x4, 'r', "", ""}, {0x1, 'r', "", ""}};
    sec_perm_set_desc set{3, t};
    uint32_t m = 0;
    char out[33];
    EXPECT_TRUE(sec_translate_perms("Ar", &set, &m) == 0 && m == 0x7);
    EXPECT_TRUE(sec_translate_bitmask(0x5, &set, out) == 0 && std::string(out) == "rr");
    EXPECT_EQ(sec_translate_bitmask(0x2, &set, out), ACL_RC_PERMISSION);
}

TEST(AclCreate, ParameterChecksInOrder) {
    const struct { unsigned char type; const char *mech, *id; int pos; } bad[] = {
        {0, nullptr, nullptr, 1}, {3, "unix", "a@b", 1}, {5, "", "", 1}, {4, "", "alice", 3},
        {8, "abcdefghijklmnopq", "alice", 3}, {4, nullptr, nullptr, 3}, {16, nullptr, "", 4},
        {4, "unix", "alice", 4}, {4, "unix", "alice@", 4}, {8, "hba2", "a@", 4}, {4, "unix", "a@b", 5},
        {32, nullptr, nullptr, 1}};
    for (const auto &b : bad) {
        sec_acle_t e = nullptr;
        EXPECT_EQ(sec_create_acle(b.type, 0, b.mech, b.id, b.pos == 5 ? nullptr : &e), ACL_RC_BAD_ARGS);
        EXPECT_TRUE(error_has(88, "parameter number: " + std::to_string(b.pos)) && !e) << b.pos;
    }
    EXPECT_TRUE(error_has(88, "sec_create_acle\n\tPositional parameter number: 1\n\tParameter value: 0x20\n"));
    // Untranslated mechanisms (as from a compiled ACL) must fit the field too.
    sec_acle_t e = nullptr;
    EXPECT_EQ(sec__create_acle(8, 0, "abcdefghijklmnopq", "id", 0, &e), ACL_RC_BAD_ARGS);
    EXPECT_TRUE(error_has(88, "sec__create_acle\n\tPositional parameter number: 3") && !e);
}

// Create, display and release an entry: "mech|id", "-" for an absent text.
std::string shown(unsigned char type, const char *mech, const char *id) {
    sec_acle_t e = nullptr;
    char *m = nullptr, *i = nullptr;
    int32_t rc = sec_create_acle(type, 0x41, mech, id, &e);
    if (rc == 0) rc = e->perm == 0x41 ? sec_display_acle_id(e, &m, &i) : -1;
    std::string out = rc ? "failed: " + rytest::error_text() : std::string(m ? m : "-") + "|" + (i ? i : "-");
    std::free(m);
    std::free(i);
    sec_release_acle(e);
    return out;
}

TEST(AclCreate, StoresOnlyWhatTheTypeNeedsAndNormalisesIpv6Registries) {
    const struct { unsigned char type; const char *mech, *id, *want; } cases[] = {
        {4, "abcdefghijklmnop", "Bob", "abcdefghijklmnop|Bob"}, {16, "unix", "staff", "-|staff"},
        {1, "unix", "staff", "-|-"}, {4, "unix", "alice@10.1.2.3", "unix|alice@10.1.2.3"},
        {4, "hba2", "alice@node1", "hba2|alice@node1"},
        {4, "UNIX", "alice@0:0:0:0:0:0:0:1", "UNIX|alice@0:0:0:0:0:0:0:1"},  // only the lower-case mechanism
    };
    for (const auto &c : cases) EXPECT_EQ(shown(c.type, c.mech, c.id), c.want);
    const std::string a = shown(4, "hba2", "alice@0:0:0:0:0:0:0:1");
    EXPECT_EQ(a, shown(4, "hba2", "alice@::0:1"));
    EXPECT_TRUE(a != "hba2|alice@0:0:0:0:0:0:0:1" && a.rfind("hba2|alice@", 0) == 0) << a;
    EXPECT_EQ(shown(8, "unix", "FE80:0:0::1"), shown(8, "unix", "fe80::0:1"));
    EXPECT_EQ(shown(8, "unix", "x@FE80:0:0::1"), shown(8, "unix", "x@fe80::0:1"));
}

TEST(AclDisplay, RefusesBadEntriesAndArguments) {
    sec_acle_desc e{};
    char *m = nullptr, *i = nullptr, **none = nullptr, id[] = "alice";
    EXPECT_TRUE(sec_display_acle_id(nullptr, &m, &i) == ACL_RC_BAD_ARGS &&
                error_has(88, "sec_display_acle_id\n\tPositional parameter number: 1"));
    EXPECT_EQ(sec_display_acle_id(&e, none, &i) + sec_display_acle_id(&e, &m, none), 8);
    EXPECT_TRUE(error_has(88, "parameter number: 3"));
    e.type = 3;
    EXPECT_TRUE(sec_display_acle_id(&e, &m, &i) == ACL_RC_BAD_ACLE && error_has(94, "(3)"));
    // No mechanism; no identity; a mechanism without its NUL in the field.
    for (int k = 0; k < 3; ++k) {
        e.type = k == 1 ? 16 : 4;
        e.id = k == 1 ? nullptr : id;
        if (k == 2) std::memset(e.mech, 'm', sizeof e.mech);
        EXPECT_TRUE(sec_display_acle_id(&e, &m, &i) == ACL_RC_BAD_ACLE && rytest::error_msgnum() == 95 && !m && !i) << k;
    }
}

}  // namespace
