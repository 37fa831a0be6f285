// Compiled ACL bytes written by hand for the library tests, independent of
// the library's own writer, and a few helpers around descriptors.
#pragma once

#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <initializer_list>
#include <span>
#include <string>
#include <utility>
#include <vector>

#include "ryacl.h"
#include "ryacl_test_support.h"

namespace libtest {

using bytes = std::vector<unsigned char>;

inline void put(bytes &b, uint32_t v, int n) {
    for (int i = 0; i < n; ++i) b.push_back(static_cast<unsigned char>(v >> (8 * i)));
}
inline uint32_t get(const bytes &b, size_t off, size_t n) {
    uint32_t v = 0;
    while (n-- > 0) v = v << 8 | b[off + n];
    return v;
}

// A call's return code with the message number it recorded, compared as one.
using rc_msg = std::pair<int32_t, int32_t>;
inline rc_msg with_msg(int32_t rc) { return {rc, rytest::error_msgnum()}; }
// The same as text: "code/message".
inline std::string code(int32_t rc) { return std::to_string(rc) + "/" + std::to_string(rytest::error_msgnum()); }

struct ent { uint32_t perm; std::string id; };  // id empty: none (types 1 and 2)

// One sub-ACL; mech "" writes no mechanism.
inline bytes subacl(unsigned type, const std::string &mech, const std::vector<ent> &entries) {
    bytes b(4, 0);  // the length, filled in last
    b.push_back(static_cast<unsigned char>(type));
    put(b, static_cast<uint32_t>(entries.size()), 4);
    b.push_back(static_cast<unsigned char>(mech.empty() ? 0 : mech.size() + 1));
    if (!mech.empty()) b.insert(b.end(), mech.c_str(), mech.c_str() + mech.size() + 1);
    for (const ent &e : entries) {
        b.push_back(1);
        put(b, e.perm, 4);
        put(b, e.id.empty() ? 0 : static_cast<uint32_t>(e.id.size() + 1), 2);
        if (!e.id.empty()) b.insert(b.end(), e.id.c_str(), e.id.c_str() + e.id.size() + 1);
    }
    for (size_t i = 0; i < 4; ++i) b[i] = static_cast<unsigned char>(b.size() >> (8 * i));
    return b;
}

inline bytes make_acl(const std::vector<bytes> &subs) {
    bytes b{0x85, 0x01, 0x02};
    put(b, static_cast<uint32_t>(subs.size()), 2);
    for (const bytes &s : subs) b.insert(b.end(), s.begin(), s.end());
    return b;
}

// The 61-byte example: anyother 1; user unix Alice 3, bob 1.
inline bytes worked_example() {
    return make_acl({subacl(SEC_ACLE_TYPE_USER, "unix", {{3, "Alice"}, {1, "bob"}}),
                     subacl(SEC_ACLE_TYPE_ANYOTHER, "", {{1, ""}})});
}

// A valid host-order ACL with every multi-byte field reversed and the byte
// ordering set to 1, walked here without the library.
inline bytes reversed(bytes b) {
    auto flip = [&](size_t off, size_t n) { std::reverse(b.begin() + long(off), b.begin() + long(off + n)); };
    size_t pos = 5;
    for (uint32_t s = 0, nsub = get(b, 3, 2); s < nsub; ++s) {
        const uint32_t len = get(b, pos, 4), count = get(b, pos + 5, 4);
        for (size_t i = 0, e = pos + 10 + b[pos + 9], next; i < count; ++i, e = next) {
            next = e + 7 + get(b, e + 5, 2);
            flip(e + 1, 4);  // permission
            flip(e + 5, 2);  // identifier length
        }
        flip(pos, 4);      // sub-ACL length
        flip(pos + 5, 4);  // entry count
        pos += len;
    }
    flip(3, 2);
    b[2] = 1;
    return b;
}

// An entry record; types 1 and 2 carry no identifier.
inline sec_acle_desc entry(unsigned type, uint32_t perm, const char *mech, const char *id) {
    sec_acle_desc e{};
    e.type = static_cast<unsigned char>(type);
    e.perm = perm;
    std::strncpy(e.mech, mech, sizeof e.mech - 1);
    e.id = type >= 4 ? const_cast<char *>(id) : nullptr;
    return e;
}

// A heap copy sized exactly, so a sanitizer sees any read past the end; no
// bytes give the empty descriptor.  Release with sec_release_acl or drop.
inline sec_buffer_desc own(const bytes &b) {
    if (b.empty()) return sec_buffer_desc{0, nullptr};
    sec_buffer_desc d{static_cast<int32_t>(b.size()), std::malloc(b.size())};
    std::memcpy(d.value, b.data(), b.size());
    return d;
}
inline bytes view(const sec_buffer_desc &d) {
    const auto *p = static_cast<const unsigned char *>(d.value);
    return d.length > 0 && p ? bytes(p, p + d.length) : bytes{};
}
inline void drop(sec_buffer_desc &d) { std::free(d.value), d = {0, nullptr}; }

using strings = std::vector<std::string>;

// A listing of the descriptor (type < 0: sec_list_acl, else by type):
// "code/message", then "type:mech:id:perm" per entry.  An empty list has no
// array; a failure leaves the list as given or empties it.
inline strings list(sec_buffer_desc &d, int type = -1, const char *mech = nullptr) {
    sec_acle_list_desc l{-1, reinterpret_cast<sec_acle_t *>(0x1)};
    const int32_t rc = type < 0 ? sec_list_acl(&d, &l) : sec_list_acl_by_type(&d, static_cast<unsigned char>(type), mech, &l);
    strings r{code(rc)};
    if (rc && l.acles == reinterpret_cast<sec_acle_t *>(0x1)) l = {0, nullptr};
    if ((l.count == 0) != (l.acles == nullptr)) r.push_back("count and array disagree");
    for (const sec_acle_desc *e : std::span(l.acles, l.acles ? size_t(l.count) : 0))
        r.push_back(std::to_string(e->type) + ":" + e->mech + ":" + (e->id ? e->id : "-") + ":" + std::to_string(e->perm));
    sec_release_aclelist(&l);
    return r;
}

// Mutants of a valid buffer: every bit flipped, every byte value (every
// `step`-th) at the offsets given, every truncation.
inline std::vector<bytes> mutants(const bytes &base, std::initializer_list<size_t> offsets, unsigned step = 1) {
    std::vector<bytes> out;
    for (size_t i = 0; i < base.size() * 8; ++i) {
        out.push_back(base);
        out.back()[i / 8] ^= static_cast<unsigned char>(1u << (i % 8));
    }
    for (size_t off : offsets)
        for (unsigned v = 0; v < 256; v += step) {
            out.push_back(base);
            out.back()[off] = static_cast<unsigned char>(v);
        }
    for (size_t n = 0; n < base.size(); ++n) out.emplace_back(base.begin(), base.begin() + long(n));
    return out;
}

}  // namespace libtest
