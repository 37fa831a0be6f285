// The compiled ACL: the writer's bytes, sub-ACLs read back (hostile ones
// too) and the limits of the layout.  (Finding sub-ACLs: the evaluation
// tests, and every mutant in test_acl_check.)
#include <gtest/gtest.h>

#include "lib_acl_bytes.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_acl_file.h"
#include "ryacl_acl_tree.h"

namespace {

using namespace libtest;
constexpr unsigned U = SEC_ACLE_TYPE_USER, G = SEC_ACLE_TYPE_GROUP, O = SEC_ACLE_TYPE_ANYOTHER;

// The worked example: users Alice (rw) and bob (r) of mechanism unix, then anyother r.
const bytes kExample = {0x85, 0x01, 0x02, 0x02, 0x00,                                // header
                        0x27, 0x00, 0x00, 0x00, 0x04, 0x02, 0x00, 0x00, 0x00, 0x05,  // user sub-ACL
                        'u', 'n', 'i', 'x', 0x00,                                    //
                        0x01, 0x03, 0x00, 0x00, 0x00, 0x06, 0x00, 'A', 'l', 'i', 'c', 'e', 0x00,
                        0x01, 0x01, 0x00, 0x00, 0x00, 0x04, 0x00, 'b', 'o', 'b', 0x00,
                        0x11, 0x00, 0x00, 0x00, 0x02, 0x01, 0x00, 0x00, 0x00, 0x00,  // anyother
                        0x01, 0x01, 0x00, 0x00, 0x00, 0x00, 0x00};
const bytes kUser(kExample.begin() + 5, kExample.begin() + 44), kOther(kExample.begin() + 44, kExample.end());

// The trees compiled; a refusal must be `want` (code, message) and leave no buffer.
bytes compile(const acl__trees_s &trees, rc_msg want = {0, 0}) {
    sec_buffer_desc acl{-1, reinterpret_cast<void *>(1)};
    const int32_t rc = sec__acltrees_to_acl(&trees, &acl);
    EXPECT_EQ(rc ? with_msg(rc) : rc_msg(0, 0), want);
    const bytes out = view(acl);
    EXPECT_EQ(acl.value == nullptr && acl.length == 0, rc != 0);
    std::free(acl.value);
    return out;
}

// A sub-ACL read from an exact-size heap copy (so that ASan sees any read
// past it) and written again.
rc_msg reread(const bytes &sub, bytes *again = nullptr) {
    sec_buffer_desc d = own(sub);
    sec_acltree_t t = reinterpret_cast<sec_acltree_t>(1);
    const rc_msg rc = with_msg(sec__subacl_to_acltree(static_cast<unsigned char *>(d.value), sub.size(), &t));
    unsigned char *out = nullptr;
    size_t len = 0;
    EXPECT_TRUE(rc.first ? t == nullptr : sec__acltree_to_subacl(t, &out, &len) == 0);
    if (again) *again = bytes(out, out + len);
    std::free(out);
    sec__free_acltree(t);
    drop(d);
    return rc;
}

TEST(AclBuffer, WorkedExampleEmptiedTreesAndReadingBack) {
    ASSERT_EQ(kExample.size(), 61u);
    EXPECT_EQ(worked_example(), kExample);  // the bytes other tests build with
    acl__trees_s trees;
    sec_acle_desc e[] = {entry(O, 1, "", ""), entry(U, 1, "unix", "bob"), entry(U, 3, "UNIX", "Alice")};
    for (auto &x : e) ASSERT_EQ(sec__add_acle_to_trees(&x, &trees), 0);
    EXPECT_EQ(compile(trees), kExample);
    // A tree emptied by deletion leaves no sub-ACL and is not counted.
    ASSERT_EQ(sec__del_acle_from_tree(&e[0], trees.trees[0]), 0);
    EXPECT_EQ(compile(trees), make_acl({kUser}));
    ASSERT_EQ(sec__del_acle_from_tree(&e[1], trees.trees[1]) | sec__del_acle_from_tree(&e[2], trees.trees[1]), 0);
    EXPECT_EQ(compile(trees), (bytes{0x85, 1, 2, 0, 0}));
    acl__free_trees(&trees);

    // Read back and written again: the same bytes; of two entries that differ
    // in case only, the first spelling with the later permission.
    bytes again;
    for (const bytes &sub : {kUser, kOther}) EXPECT_TRUE(reread(sub, &again).first == 0 && again == sub);
    EXPECT_EQ(reread(subacl(G, "", {{1, "Staff"}, {3, "staff"}}), &again).first, 0);
    EXPECT_EQ(again, subacl(G, "", {{3, "Staff"}}));
}

TEST(AclBuffer, HostileSubaclsAreRefusedWithTheirMessages) {
    for (const bytes &sub : {kUser, kOther})
        for (size_t n = 1; n < sub.size(); ++n)
            EXPECT_EQ(reread(bytes(sub.begin(), sub.begin() + long(n))), rc_msg(ACL_RC_BAD_ACL, 97)) << n;
    auto set = [](bytes b, size_t at, unsigned char v) { return b[at] = v, b; };
    const struct { bytes sub; int32_t rc, msg; } cases[] = {
        {set(kUser, 9, 18), ACL_RC_BAD_ACL, 110},     // mechanism longer than its 17-byte field
        {set(kUser, 9, 1), ACL_RC_BAD_ACL, 110},      // empty mechanism
        {set(kUser, 14, 'x'), ACL_RC_BAD_ACL, 111},   // mechanism without its NUL
        {set(kUser, 27, 'x'), ACL_RC_BAD_ACLE, 114},  // "Alice" without its NUL
        {set(kUser, 20, 0), ACL_RC_BAD_ACLE, 114},    // identifier length 0
        {set(kUser, 8, 0x7f), ACL_RC_BAD_ACL, 97},    // a count that lies: the entries run out first
        {set(kUser, 4, 3), ACL_RC_BAD_ACL, 107},      // no such type
        {set(kOther, 5, 2), ACL_RC_BAD_ACL, 98},      // two anyother entries
    };
    for (const auto &c : cases) EXPECT_EQ(reread(c.sub), rc_msg(c.rc, c.msg)) << &c - cases;
}

TEST(AclBuffer, LimitsAreRefusedNotWrapped) {
    const std::string longest(65534, 'x'), over(65535, 'y');
    acl__trees_s trees;
    sec_acle_desc a = entry(G, 1, "", longest.c_str()), b = entry(G, 1, "", over.c_str());
    ASSERT_EQ(sec__add_acle_to_trees(&a, &trees), 0);
    EXPECT_EQ(get(compile(trees), 5 + 15, 2), 65535u);  // the identifier's length field, NUL included
    ASSERT_EQ(sec__add_acle_to_trees(&b, &trees), 0);  // one byte more
    EXPECT_EQ(compile(trees, {ACL_RC_BAD_ACLE, 95}), bytes{});
    ASSERT_EQ(sec__del_acle_from_tree(&b, trees.trees[0]), 0);  // and compiles again without it
    EXPECT_EQ(get(compile(trees), 5 + 15, 2), 65535u);
    acl__free_trees(&trees);

    // 65535 sub-ACLs fill the 16-bit count; one more is refused as over
    // the format's limit; each met again with its mechanism in other case
    // finds its own.
    for (int i = 0; i < 65536 * 2; ++i) {
        const std::string mech = (i < 65536 ? "m" : "M") + std::to_string(i % 65536);
        sec_acle_desc e = entry(U, 1, mech.c_str(), i < 65536 ? "u" : "v");
        ASSERT_EQ(sec__add_acle_to_trees(&e, &trees), 0);
        if (i == 65534) {
            EXPECT_EQ(get(compile(trees), 3, 2), 65535u);
        }
    }
    EXPECT_TRUE(trees.nooftrees == 65536 && acl__tree_count(trees.trees[12345]) == 2);
    EXPECT_EQ(compile(trees, {ACL_RC_BAD_ACL, 167}), bytes{});
    acl__free_trees(&trees);
}

}  // namespace

namespace {

struct quiet_sink final : acl__text_sink {
    void fault(int32_t, int32_t) override {}
};

// The text's entries parsed into trees, the trees keeping their identifiers
// in the text or not.
void parse_into(std::string &text, bool borrow, acl__trees_s *trees) {
    acl__textfile_opts o{ACL_RC_FILE_ERROR, 0, 0, 0};
    o.trees_borrow_text = borrow;
    quiet_sink sink;
    acl__parse_result res;
    ASSERT_EQ(acl__parse_acltext(text.data(), text.size(), o, sink, trees, &res), 0);
}

}  // namespace

// Trees that keep their identifiers in the parsed text compile as copying
// ones do; an entry from elsewhere gives a tree its own copies (each
// allocation on the way failing in turn leaves the trees as they were), after
// which the text can go.
TEST(AclBuffer, IdentifiersBorrowedFromTheTextUntilAnEntryComesFromElsewhere) {
    std::string lines;
    for (int i = 0; i < 40; ++i) lines += "u unix user" + std::to_string((i * 17) % 40) + "@Example r\n";
    lines += "u krb lone rw\n";
    std::string a = lines, b = lines;
    acl__trees_s borrowed, copied;
    parse_into(a, true, &borrowed);
    parse_into(b, false, &copied);
    ASSERT_EQ(borrowed.nooftrees, 2);
    EXPECT_EQ(compile(borrowed), compile(copied));

    sec_acle_desc more[] = {entry(U, 2, "unix", "zed"), entry(U, 2, "KRB", "other")};
    for (const sec_acle_desc &m : more) {
        auto flow = [&] { return sec__add_acle_to_trees(&m, &borrowed); };
        auto check = [&](int32_t rc, long) {
            EXPECT_EQ(with_msg(rc), rc_msg(ACL_RC_NO_MEMORY, 89));
            EXPECT_EQ(compile(borrowed), compile(copied));
        };
        EXPECT_GE(rytest::for_each_alloc_failure(flow, check), 1);
        ASSERT_EQ(sec__add_acle_to_trees(&m, &copied), 0);
    }
    std::fill(a.begin(), a.end(), 'X');  // the text's bytes reused
    EXPECT_EQ(compile(borrowed), compile(copied));
    acl__free_trees(&borrowed);
    acl__free_trees(&copied);
}
