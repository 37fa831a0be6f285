// Indexed evaluation: creation refuses what validation refuses, with its
// record; every answer is the walk's on the same bytes, handlers included.
#include <gtest/gtest.h>

#include "lib_acl_bytes.h"

namespace {

using namespace libtest;

std::string outcome(int32_t rc) { return std::to_string(rc) + "/" + rytest::error_text(); }

// Handlers note each entry shown; the notes must match between walk and index.
std::string g_seen;
int32_t h_note(const char *client, const char *entry) {
    g_seen += std::string(entry) + ",";
    return std::strcmp(client, entry);
}

// The index of b; the bytes it was made from are scribbled over and freed
// at once, so every later answer comes from the index alone.
sec_acl_index_t index_of(const bytes &b) {
    sec_buffer_desc d = own(b);
    sec_acl_index_t ix = nullptr;
    EXPECT_EQ(outcome(sec_create_acl_index(&d, &ix)), "0/");
    std::memset(d.value, 0, b.size());
    drop(d);
    return ix;
}

// Creation checks each rule in the same walk that fills the tables, and
// reads identifiers of under 32 bytes as whole vectors where 32 bytes
// follow them: the mutants of the second ACL (identifiers around 16 and 32
// bytes, a sub-ACL repeated, entries far from the end) reach that path.
TEST(IndexCreation, RefusesWhatValidationRefusesWithTheSameRecord) {
    const bytes small = make_acl({subacl(4, "unix", {{1, "alice"}, {2, "bob"}}), subacl(16, "", {{4, "adm"}}),
                                  subacl(2, "", {{8, ""}})});
    const bytes wide = make_acl({subacl(4, "unix", {{1, ""}, {2, std::string(15, 'a')}, {4, std::string(16, 'B')},
                                                    {8, std::string(31, 'c')}, {16, std::string(32, 'd')}}),
                                 subacl(4, "UNIX", {{1, std::string(17, 'e')}}), subacl(16, "", {{4, "adm"}}),
                                 subacl(8, "k", {{2, "x/y"}}), subacl(2, "", {{8, ""}})});
    const size_t wide_id = 5 + 10 + 5 + 7 + 1 + 7 + 16;  // the entry of the 16-byte identifier
    for (const bytes *base : {&small, &wide}) {
        size_t refused = 0;
        for (const bytes &m : base == &small ? mutants(small, {3, 5, 9, 14, 20})
                                             : mutants(wide, {wide_id - 2, wide_id + 5, wide_id + 16})) {
            if (m.size() > 2 && m[2] != 2) continue;  // the other byte order: below
            sec_buffer_desc conv = own(m), given = own(m);
            const std::string want = outcome(sec_convert_acl_to_host(1, &conv));
            sec_acl_index_t ix = reinterpret_cast<sec_acl_index_t>(&given);
            ASSERT_EQ(outcome(sec_create_acl_index(&given, &ix)), want) << base->size();
            EXPECT_EQ(ix == nullptr, want != "0/");
            refused += ix == nullptr;
            sec_release_acl_index(ix);
            drop(conv);
            drop(given);
        }
        EXPECT_GT(refused, base->size());
    }
    // Each sub-ACL header well formed, but the first one's length skips a
    // whole sub-ACL: the next does not begin where its entries end.
    const bytes g = subacl(16, "", {{4, "adm"}});
    bytes skip = make_acl({subacl(4, "unix", {{1, "alice"}}), g, g});
    skip[3] = 2;
    skip[5] = static_cast<unsigned char>(skip[5] + g.size());
    sec_buffer_desc sd = own(skip);
    sec_acl_index_t six = nullptr;
    EXPECT_EQ(with_msg(sec_create_acl_index(&sd, &six)), rc_msg(ACL_RC_BAD_ACL, 97));
    EXPECT_EQ(six, nullptr);
    drop(sd);
    const bytes &base = small;
    sec_buffer_desc d = own(reversed(base));
    sec_acl_index_t ix = nullptr;
    EXPECT_EQ(with_msg(sec_create_acl_index(&d, &ix)), rc_msg(ACL_RC_BAD_ACL, 102));
    EXPECT_EQ(view(d), reversed(base));  // not converted behind the caller's back
    EXPECT_EQ(with_msg(sec_create_acl_index(nullptr, &ix)), rc_msg(ACL_RC_BAD_ARGS, 88));
    EXPECT_NE(rytest::error_text().find("sec_create_acl_index\n\tPositional parameter number: 1"), std::string::npos);
    EXPECT_EQ(with_msg(sec_create_acl_index(&d, nullptr)), rc_msg(ACL_RC_BAD_ARGS, 88));
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 2"), std::string::npos);
    drop(d);
}

TEST(IndexCreation, EveryAllocationFailureIsReportedAndLeavesNoIndex) {
    const bytes b = make_acl({subacl(4, "unix", {{1, "a"}}), subacl(16, "", {{2, "g"}}), subacl(8, "k", {{4, "x"}})});
    sec_buffer_desc d = own(b);
    sec_acl_index_t ix = nullptr;
    const long sites = rytest::for_each_alloc_failure(
        [&] { return sec_create_acl_index(&d, &ix); },
        [&](int32_t rc, long nth) {
            EXPECT_EQ(with_msg(rc), rc_msg(ACL_RC_NO_MEMORY, 89)) << nth;
            EXPECT_NE(rytest::error_text().find("sec_create_acl_index"), std::string::npos) << nth;
            EXPECT_EQ(ix, nullptr) << nth;
        },
        [&] { sec_release_acl_index(ix), ix = nullptr; });
    EXPECT_EQ(sites, 2);  // the tables' block and the copy
    sec_release_acl_index(ix);  // the run that reached no failure
    drop(d);
    // Both blocks are taken before the entries are checked: an entry that
    // breaks a rule is still refused as validation refuses it.
    bytes bad = make_acl({subacl(16, "", {{2, "g"}})});
    bad[15] = 2;  // the entry's version
    d = own(bad);
    for (long nth : {1, 2}) {
        rytest::alloc_fail_nth(nth);
        EXPECT_EQ(with_msg(sec_create_acl_index(&d, &ix)), rc_msg(ACL_RC_BAD_ACLE, 112)) << nth;
        rytest::alloc_fail_none();
        EXPECT_EQ(ix, nullptr) << nth;
    }
    drop(d);
}

// One query through the walk and through the index: code, full record, mask
// and the entries the handlers were shown, with the operation's name as
// the walk's so refused parameters compare too.
struct query {
    unsigned type;  // 0: groups
    const char *mech, *zmech, *id;
    std::vector<const char *> groups = {};
    int32_t count = -2;  // -2: the number of groups
};
std::string answer(const query &q, sec_buffer_desc *acl, sec_acl_index_t ix) {
    std::vector<sec_buffer_desc> g;
    for (const char *n : q.groups) g.push_back({0, const_cast<char *>(n)});
    const int32_t count = q.count == -2 ? static_cast<int32_t>(g.size()) : q.count;
    uint32_t perm = 0xdead;
    g_seen.clear();
    const auto t = static_cast<unsigned char>(q.type);
    int32_t rc = !q.type ? (acl ? sec__group_acles_perm(acl, count, g.data(), &perm)
                                : sec_index_group_acles_perm(ix, count, g.data(), &perm))
                         : (acl ? sec__single_acle_perm(acl, t, q.mech, q.zmech, q.id, &perm)
                                : sec_index_single_acle_perm(ix, t, q.mech, q.zmech, q.id, &perm));
    std::string text = rytest::error_text();
    for (const char *name : {"sec_index_single_acle_perm", "sec_index_group_acles_perm"})
        if (size_t at = text.find(name); at != std::string::npos) text.replace(at, std::strlen(name), "walk");
    for (const char *name : {"sec__single_acle_perm", "sec__group_acles_perm"})
        if (size_t at = text.find(name); at != std::string::npos) text.replace(at, std::strlen(name), "walk");
    return std::to_string(rc) + " " + std::to_string(perm) + " " + g_seen + "|" + text;
}

// Entries out of order, identifiers repeated in other cases, sub-ACLs
// repeated under another case of their mechanism, a last sub-ACL whose
// length does not cover its mechanism, handlers registered after the index.
TEST(IndexEvaluation, AnswersAsTheWalkOnTheBytesItWasMadeFrom) {
    const bytes b = make_acl({subacl(4, "unix", {{1, "m"}, {2, "c"}, {4, "t"}, {8, "C"}, {16, "z"}, {32, "M"}}),
                              subacl(4, "UNIX", {{64, "a"}}), subacl(16, "", {{1, "st"}, {2, "ad"}, {4, "wh"}, {8, "AD"}}),
                              subacl(16, "", {{16, "zz"}}), subacl(8, "hnd", {{1, "x/2"}, {2, "x/1"}}), subacl(2, "", {}),
                              subacl(1, "", {{0x20, ""}}), subacl(4, "late", {{1, "a"}})});
    bytes cut = b;
    cut[b.size() - 24] = 12;  // the last sub-ACL's length field short of its mechanism
    for (const bytes &acl : {b, cut}) {
        sec_acl_index_t ix = index_of(acl);
        sec_buffer_desc d = own(acl);
        const std::vector<query> qs = {
            {4, "unix", nullptr, "m"},  {4, "unix", nullptr, "c"},   {4, "Unix", nullptr, "T"},  {4, "unix", nullptr, "z"},
            {4, "unix", nullptr, "a"},  {4, "nfs", "UNIX", "M"},     {4, "unix", "unix2", "m"},  {4, "late", nullptr, "a"},
            {0x84, "hnd", nullptr, "m"}, {0x84, "hnd", "unix", "t"}, {8, "hnd", nullptr, "x/1"}, {8, "HND", nullptr, "x/3"},
            {2, nullptr, nullptr, nullptr}, {1, "any", nullptr, nullptr}, {16, "unix", nullptr, "m"}, {4, "", nullptr, "m"},
            {8, "hnd", nullptr, ""},    {0, nullptr, nullptr, nullptr, {"AD", "st", "zz", "wh", "ad"}},
            {0, nullptr, nullptr, nullptr, {"ad"}, -1},     {0, nullptr, nullptr, nullptr, {}, 0},
            {0, nullptr, nullptr, nullptr, {"nope", nullptr}}, {0, nullptr, nullptr, nullptr, {}, 3},
            {4, "unix", nullptr, "m", {}, 0}};
        for (int pass = 0; pass < 2; ++pass) {  // before and after the handlers arrive
            for (const query &q : qs) EXPECT_EQ(answer(q, nullptr, ix), answer(q, &d, nullptr)) << q.id;
            if (pass == 0) {
                static const bool registered =
                    sec__register_id_handler(SEC_ID_HANDLER_USER, "hnd", h_note) == 0 &&
                    sec__register_id_handler(SEC_ID_HANDLER_EXPANDED, "HND", h_note) == 0;
                ASSERT_TRUE(registered);
            }
        }
        uint32_t perm = 0;
        EXPECT_EQ(outcome(sec_index_single_acle_perm(nullptr, 4, "u", nullptr, "i", &perm)).substr(0, 2), "4/");
        EXPECT_NE(rytest::error_text().find("sec_index_single_acle_perm\n\tPositional parameter number: 1"),
                  std::string::npos);
        EXPECT_EQ(with_msg(sec_index_single_acle_perm(ix, 4, "u", nullptr, "i", nullptr)), rc_msg(ACL_RC_BAD_ARGS, 88));
        EXPECT_EQ(with_msg(sec_index_group_acles_perm(nullptr, 0, nullptr, &perm)), rc_msg(ACL_RC_BAD_ARGS, 88));
        EXPECT_NE(rytest::error_text().find("sec_index_group_acles_perm"), std::string::npos);
        drop(d);
        sec_release_acl_index(ix);
    }
    sec_release_acl_index(nullptr);
}

// Tables far larger than the cache, with entries out of order and
// identifiers repeated in another case, of 7 to 47 bytes (hashed from
// whole vectors below 32, a byte at a time from 32), answer as the walk does.
TEST(IndexEvaluation, LargeTablesAnswerAsTheWalk) {
    constexpr int kCount = 70000;
    auto name = [](int k, bool upper) {
        char id[16];
        std::snprintf(id, sizeof id, upper ? "U%06d" : "u%06d", k);
        return id + std::string(static_cast<size_t>(k % 41), upper ? 'X' : 'x');
    };
    std::vector<ent> es;
    for (int i = 0; i < kCount; ++i) {
        const int k = i % 97 == 0 ? i - 500 : i % 101 == 0 ? i - 3 : i;
        es.push_back({1u << (i % 13), name(k < 0 ? -k : k, i % 101 == 0)});
    }
    const bytes b = make_acl({subacl(4, "unix", es), subacl(16, "", es)});
    sec_acl_index_t ix = index_of(b);
    sec_buffer_desc d = own(b);
    for (int i = 0; i < kCount + 200; i += 173) {
        const std::string id = name(i, i % 2);
        EXPECT_EQ(answer({4, "unix", nullptr, id.c_str()}, nullptr, ix),
                  answer({4, "unix", nullptr, id.c_str()}, &d, nullptr)) << id;
        EXPECT_EQ(answer({0, nullptr, nullptr, nullptr, {id.c_str()}}, nullptr, ix),
                  answer({0, nullptr, nullptr, nullptr, {id.c_str()}}, &d, nullptr)) << id;
    }
    drop(d);
    sec_release_acl_index(ix);
}

}  // namespace
