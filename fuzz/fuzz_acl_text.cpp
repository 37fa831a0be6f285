// Any bytes as an ACL text: parsed line by line the way the checker does
// with -c (faulty lines and duplicates are reported and passed over), the
// accepted entries gathered into trees and compiled.  The compiled ACL must
// be exactly the bytes a plain model of the accepted entries gives, pass
// validation, list back as those entries, grant each entry's permission,
// and dump without fault.
#include <algorithm>
#include <cctype>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <map>
#include <tuple>
#include <utility>
#include <vector>

#include "fuzz_model.h"
#include "ry_zo.h"
#include "ryacl.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_acl_dump.h"
#include "ryacl_acl_entry.h"
#include "ryacl_acl_file.h"
#include "ryacl_acl_tree.h"

namespace {

using namespace fuzzmodel;

bool is_token_byte(unsigned char c) { return c != 0 && c != '\n' && c != '\f' && c != '\r' && !std::isspace(c); }

// What the parser hands out must be a token of the line as it stood: the
// identifier points into the text at a run of token bytes ended by a
// byte the parser overwrote, and the mechanism is a lower-cased token.
void check_entry(const sec_acle_desc &e, const std::vector<char> &text, const std::vector<char> &orig) {
    FUZZ_CHECK(e.type == SEC_ACLE_TYPE_UNAUTHENTICATED || e.type == SEC_ACLE_TYPE_ANYOTHER ||
               e.type == SEC_ACLE_TYPE_USER || e.type == SEC_ACLE_TYPE_EXPANDED || e.type == SEC_ACLE_TYPE_GROUP);
    FUZZ_CHECK((e.perm & ~0x1fffu) == 0);  // only the 13 default templates
    FUZZ_CHECK(has_id(e.type) == (e.id != nullptr));
    const size_t mlen = strnlen(e.mech, sizeof e.mech);
    FUZZ_CHECK(mlen < sizeof e.mech);
    FUZZ_CHECK(has_mech(e.type) == (mlen > 0));
    for (size_t i = 0; i < mlen; ++i) {
        const auto c = static_cast<unsigned char>(e.mech[i]);
        FUZZ_CHECK(is_token_byte(c) && !(c >= 'A' && c <= 'Z'));
    }
    if (!e.id) return;
    FUZZ_CHECK(e.id >= text.data() && e.id < text.data() + text.size());
    const size_t off = static_cast<size_t>(e.id - text.data());
    const size_t len = std::strlen(e.id);
    FUZZ_CHECK(len > 0 && off + len < text.size());
    FUZZ_CHECK(std::memcmp(e.id, orig.data() + off, len) == 0);
    for (size_t i = 0; i < len; ++i) FUZZ_CHECK(is_token_byte(static_cast<unsigned char>(e.id[i])));
    FUZZ_CHECK(!is_token_byte(static_cast<unsigned char>(orig[off + len])));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    // Long inputs only repeat what short ones reach, more slowly.
    if (size > (1u << 16)) return 0;
    quiet_library_streams();

    std::vector<char> text(data, data + size);
    text.push_back('\0');
    const std::vector<char> orig = text;

    char *cursor = text.data();
    size_t left = text.size();
    int32_t lineno = 1;
    acl__trees_s trees;
    acl model;  // sub-ACLs in order of first appearance
    std::map<std::pair<int, std::string>, size_t> sub_of;            // (type, folded mech)
    std::map<std::tuple<int, std::string, std::string>, bool> seen;  // identities accepted
    bool clean = true;  // no faulty line, no duplicate

    for (;;) {
        sec_acle_desc e;
        std::memset(&e, 0x5a, sizeof e);
        const int32_t before = lineno;
        const int32_t rc = sec__read_acle_from_text(nullptr, &cursor, &left, &lineno, &e);
        if (rc == 0) {
            FUZZ_CHECK(lineno == before && e.type == 0 && e.id == nullptr);
            break;
        }
        FUZZ_CHECK(lineno == before + 1);
        // The cursor and the bytes left always describe the rest of the text.
        if (cursor) FUZZ_CHECK(cursor + left == text.data() + text.size() && left >= 1);
        else FUZZ_CHECK(left == 0);
        if (rc != 1) {
            const int32_t msg = current_msgnum();
            FUZZ_CHECK((rc == ACL_RC_FILE_ERROR && msg == 145) || (rc == ACL_RC_PERMISSION && msg == 166) ||
                       (rc == ACL_RC_BAD_ACL && (msg == 165 || msg == 132 || msg == 158 || msg == 159 || msg == 131)));
            clean = false;
            continue;
        }
        if (e.type == 0) continue;
        check_entry(e, text, orig);

        const std::string mech = has_mech(e.type) ? e.mech : "";
        const std::string id = e.id ? e.id : "";
        auto key = std::make_tuple(static_cast<int>(e.type), folded(mech), folded(id));
        const int32_t add = sec__add_acle_to_trees(&e, &trees);
        if (seen.count(key)) {
            const int32_t msg = current_msgnum();
            FUZZ_CHECK(add == ACL_RC_BAD_ACLE && (msg == 160 || msg == 144 || msg == 161));
            clean = false;
            continue;
        }
        FUZZ_CHECK(add == 0);
        seen[key] = true;
        auto at = sub_of.emplace(std::make_pair(static_cast<int>(e.type), folded(mech)), model.subs.size());
        if (at.second) model.subs.push_back(subacl{e.type, mech, {}});
        model.subs[at.first->second].entries.emplace_back(id, e.perm);
    }

    // The writer lays the trees down from the last to the first.
    std::vector<size_t> order = in_order(model);
    std::reverse(order.begin(), order.end());
    const std::vector<unsigned char> expected = compile(model, order);
    sec_acl_buffer_desc compiled{0, nullptr};
    FUZZ_CHECK(sec__acltrees_to_acl(&trees, &compiled) == 0);
    acl__free_trees(&trees);
    FUZZ_CHECK(same_bytes(compiled, expected));
    // The checker's own road (lines parsed a batch ahead, identifiers left
    // in the text) compiles the same bytes, from an exact-size copy.
    {
        std::vector<char> again;
        again.reserve(orig.size());
        again.assign(orig.begin(), orig.end());
        acl__textfile_opts o{ACL_RC_FILE_ERROR, 0, 0, 0};
        o.keep_going = true;
        o.trees_borrow_text = true;
        struct : acl__text_sink {
            void fault(int32_t, int32_t) override {}
        } sink;
        acl__trees_s batched;
        acl__parse_result res;
        FUZZ_CHECK(acl__parse_acltext(again.data(), again.size() - 1, o, sink, &batched, &res) == 0);
        sec_acl_buffer_desc second{0, nullptr};
        FUZZ_CHECK(sec__acltrees_to_acl(&batched, &second) == 0);
        acl__free_trees(&batched);
        FUZZ_CHECK(same_bytes(second, expected));
        std::free(second.value);

        // With duplicates left to the ordered visit and no going past a
        // fault: a clean text compiles the same bytes; any other stops the
        // parse or fails the compilation with a duplicate's report.
        again.assign(orig.begin(), orig.end());
        o.keep_going = false;
        acl__trees_s deferred;
        deferred.defer_duplicates = true;
        const int32_t stopped = acl__parse_acltext(again.data(), again.size() - 1, o, sink, &deferred, &res);
        sec_acl_buffer_desc third{0, nullptr};
        const int32_t made = stopped ? -1 : sec__acltrees_to_acl(&deferred, &third);
        if (made > 0) FUZZ_CHECK(made == ACL_RC_BAD_ACLE && (current_msgnum() == 144 || current_msgnum() == 161));
        acl__free_trees(&deferred);
        FUZZ_CHECK(clean == (made == 0));
        if (made == 0) FUZZ_CHECK(same_bytes(third, expected));
        std::free(third.value);
    }
    FUZZ_CHECK(sec_convert_acl_to_host(1, &compiled) == 0);

    std::vector<listed> want;
    for (size_t k : order) append_listed(model.subs[k], want);
    sec_acle_list_desc list{0, nullptr};
    FUZZ_CHECK(sec_list_acl(&compiled, &list) == 0);
    FUZZ_CHECK(read_list(list) == want);
    sec_release_aclelist(&list);
    for (unsigned char t : {1, 2, 4, 8, 16}) {
        FUZZ_CHECK(sec_list_acl_by_type(&compiled, t, nullptr, &list) == 0);
        size_t n = 0;
        for (const listed &w : want) n += w.type == t;
        FUZZ_CHECK(static_cast<size_t>(list.count) == n);
        sec_release_aclelist(&list);
    }

    // Every entry but the expanded ones (matched only through a handler)
    // grants its own permission; a sample of them keeps long inputs fast.
    const size_t step = want.size() / 64 + 1;
    for (size_t i = 0; i < want.size(); i += step) {
        const listed &w = want[i];
        uint32_t perm = 0xdeadbeef;
        if (w.type == SEC_ACLE_TYPE_GROUP) {
            sec_buffer_desc name{0, const_cast<char *>(w.id.c_str())};
            FUZZ_CHECK(sec__group_acles_perm(&compiled, 1, &name, &perm) == 0);
        } else if (w.type != SEC_ACLE_TYPE_EXPANDED) {
            FUZZ_CHECK(sec__single_acle_perm(&compiled, w.type, w.type == SEC_ACLE_TYPE_USER ? w.mech.c_str() : nullptr,
                                             nullptr, w.type == SEC_ACLE_TYPE_USER ? w.id.c_str() : nullptr, &perm) == 0);
        } else {
            continue;
        }
        FUZZ_CHECK(perm == w.perm);
    }

    sec__dump_acl(&compiled);
    FUZZ_CHECK(sec_release_acl(&compiled) == 0);
    return 0;
}
