// Listing compiled ACLs as entry records.
#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "lib_acl_bytes.h"
#include "ryacl.h"
#include "ryacl_test_support.h"

namespace {

using namespace libtest;
using strings = std::vector<std::string>;

const bytes kAcl = make_acl({subacl(4, "unix", {{3, "Alice"}, {1, "bob"}}), subacl(2, "", {{1, ""}}),
                             subacl(4, "krb", {{2, "k1"}}), subacl(16, "", {{4, "staff"}}),
                             subacl(4, "Unix", {{5, "shadowed"}})});

// Entries as "type:mech:id:perm"; empty: count 0 and no array, or never touched.
struct listed { int32_t rc; strings entries; bool empty; };

listed list(const bytes &b, int type = -1, const char *mech = nullptr) {
    sec_buffer_desc d = own(b);
    sec_acle_list_desc l{-1, reinterpret_cast<sec_acle_t *>(0x1)};
    int32_t rc = type < 0 ? sec_list_acl(&d, &l) : sec_list_acl_by_type(&d, static_cast<unsigned char>(type), mech, &l);
    listed r{rc, {}, true};
    if (rc == 0 || l.acles != reinterpret_cast<sec_acle_t *>(0x1)) {
        for (int32_t i = 0; i < l.count; ++i) {
            const sec_acle_desc *e = l.acles[i];
            r.entries.push_back(std::to_string(e->type) + ":" + e->mech + ":" + (e->id ? e->id : "-") + ":" +
                                std::to_string(e->perm));
        }
        r.empty = l.count == 0 && l.acles == nullptr;
        sec_release_aclelist(&l);
    }
    drop(d);
    return r;
}

TEST(List, WholeAclInBufferOrderAndByTypeAndMechanism) {
    // With a mechanism, only the first sub-ACL that matches it.
    struct row { int type; const char *mech; strings want; } const rows[] = {
        {-1, nullptr, {"4:unix:Alice:3", "4:unix:bob:1", "2::-:1", "4:krb:k1:2", "16::staff:4", "4:Unix:shadowed:5"}},
        {4, nullptr, {"4:unix:Alice:3", "4:unix:bob:1", "4:krb:k1:2", "4:Unix:shadowed:5"}},
        {4, "UNIX", {"4:unix:Alice:3", "4:unix:bob:1"}},
        {16, "ignored", {"16::staff:4"}},
        {2, nullptr, {"2::-:1"}},
        {8, nullptr, {}},
        {4, "nfs", {}},
    };
    for (const row &r : rows) {
        listed got = list(kAcl, r.type, r.mech);
        EXPECT_EQ(got.rc, 0);
        EXPECT_EQ(got.entries, r.want) << r.type;
        EXPECT_EQ(got.empty, r.want.empty()) << r.type;
    }
    for (const bytes &b : {bytes{}, bytes{0x85, 1, 2, 0, 0}}) EXPECT_TRUE(list(b).empty);
    bytes other = make_acl({subacl(2, "", {{0, ""}})});
    other[2] = 7;  // the byte order is not the listing's concern
    EXPECT_EQ(list(other).rc, 0);
}

TEST(List, RefusedParametersAndBuffers) {
    struct row { bytes acl; int type; const char *mech; int32_t rc; const char *says; } const rows[] = {
        {kAcl, 4, "abcdefghijklmnopq", 4, "number: 3"}, {kAcl, 4, "", 4, "number: 3"},
        {kAcl, 3, nullptr, 4, "number: 2\n\tParameter value: 0x3"},
        {{0x84, 1, 2, 0, 0}, -1, nullptr, 42, "4471-109"}, {{0x85, 2, 2, 0, 0}, 4, nullptr, 42, "4471-109"}};
    for (const row &r : rows) {
        EXPECT_EQ(list(r.acl, r.type, r.mech).rc, r.rc) << r.says;
        EXPECT_NE(rytest::error_text().find(r.says), std::string::npos) << r.says;
    }
    sec_acle_list_desc l{0, nullptr};
    sec_buffer_desc d = own(kAcl), lying{5, nullptr};
    EXPECT_EQ(sec_list_acl_by_type(&d, 4, nullptr, nullptr), ACL_RC_BAD_ARGS);
    EXPECT_NE(rytest::error_text().find("Positional parameter number: 4"), std::string::npos);
    drop(d);
    EXPECT_EQ(with_msg(sec_list_acl(&lying, &l)), rc_msg(ACL_RC_BAD_ACL, 96));  // the length alone is not read through
    sec_release_aclelist(nullptr);  // absent and empty lists are left alone
    sec_acle_list_desc zero{0, reinterpret_cast<sec_acle_t *>(0x1)};
    sec_release_aclelist(&zero);
    EXPECT_EQ(zero.acles, reinterpret_cast<sec_acle_t *>(0x1));
}

}  // namespace
