// Compiled ACL bytes written by hand for the library tests, independent of
// the library's own writer, and a few helpers around descriptors.
#pragma once

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <initializer_list>
#include <string>
#include <utility>
#include <vector>

#include "ryacl.h"

namespace libtest {

using bytes = std::vector<unsigned char>;

inline void put16(bytes &b, unsigned v) {
    b.push_back(static_cast<unsigned char>(v));
    b.push_back(static_cast<unsigned char>(v >> 8));
}
inline void put32(bytes &b, uint32_t v) {
    for (int i = 0; i < 4; ++i) b.push_back(static_cast<unsigned char>(v >> (8 * i)));
}

struct ent {
    uint32_t perm;
    std::string id;  // empty: no identifier (types 1 and 2)
};

// One sub-ACL; mech "" writes no mechanism.
inline bytes subacl(unsigned type, const std::string &mech, const std::vector<ent> &entries) {
    bytes b;
    put32(b, 0);
    b.push_back(static_cast<unsigned char>(type));
    put32(b, static_cast<uint32_t>(entries.size()));
    b.push_back(static_cast<unsigned char>(mech.empty() ? 0 : mech.size() + 1));
    if (!mech.empty()) b.insert(b.end(), mech.c_str(), mech.c_str() + mech.size() + 1);
    for (const ent &e : entries) {
        b.push_back(1);
        put32(b, e.perm);
        put16(b, e.id.empty() ? 0 : static_cast<unsigned>(e.id.size() + 1));
        if (!e.id.empty()) b.insert(b.end(), e.id.c_str(), e.id.c_str() + e.id.size() + 1);
    }
    const uint32_t n = static_cast<uint32_t>(b.size());
    for (int i = 0; i < 4; ++i) b[static_cast<size_t>(i)] = static_cast<unsigned char>(n >> (8 * i));
    return b;
}

inline bytes make_acl(const std::vector<bytes> &subs) {
    bytes b{0x85, 0x01, 0x02};
    put16(b, static_cast<unsigned>(subs.size()));
    for (const bytes &s : subs) b.insert(b.end(), s.begin(), s.end());
    return b;
}

// The 61-byte example: anyother 1; user unix Alice 3, bob 1.
inline bytes worked_example() {
    return make_acl({subacl(SEC_ACLE_TYPE_USER, "unix", {{3, "Alice"}, {1, "bob"}}),
                subacl(SEC_ACLE_TYPE_ANYOTHER, "", {{1, ""}})});
}

// A heap copy in a descriptor, sized exactly, so a sanitizer sees any read
// past the end; no bytes give the empty descriptor.  Release with
// sec_release_acl or free.
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
inline void drop(sec_buffer_desc &d) {
    std::free(d.value);
    d.value = nullptr;
    d.length = 0;
}

// Mutants of a valid buffer: every bit flipped, every byte value (every
// `step`-th) at the offsets given, every truncation.
inline std::vector<bytes> mutants(const bytes &base, std::initializer_list<size_t> offsets,
                                  unsigned step = 1) {
    std::vector<bytes> out;
    for (size_t i = 0; i < base.size() * 8; ++i) {
        out.push_back(base);
        out.back()[i / 8] ^= static_cast<unsigned char>(1u << (i % 8));
    }
    for (size_t off : offsets) {
        for (unsigned v = 0; v < 256; v += step) {
            out.push_back(base);
            out.back()[off] = static_cast<unsigned char>(v);
        }
    }
    for (size_t n = 0; n < base.size(); ++n) out.emplace_back(base.begin(), base.begin() + n);
    return out;
}

// Entries of a list as "type:mech:id:perm" strings.
inline std::vector<std::string> describe(const sec_acle_list_desc &l) {
    std::vector<std::string> out;
    for (int32_t i = 0; i < l.count; ++i) {
        const sec_acle_desc *e = l.acles[i];
        out.push_back(std::to_string(e->type) + ":" + e->mech + ":" + (e->id ? e->id : "-") + ":" +
                      std::to_string(e->perm));
    }
    return out;
}

// An entry record on the stack.
struct entry_rec {
    sec_acle_desc d{};
    std::string id;
    entry_rec(unsigned type, uint32_t perm, const std::string &mech, const std::string &ident,
              bool with_id = true)
        : id(ident) {
        d.type = static_cast<unsigned char>(type);
        d.perm = perm;
        std::strncpy(d.mech, mech.c_str(), sizeof d.mech - 1);
        d.id = with_id ? const_cast<char *>(id.c_str()) : nullptr;
    }
    sec_acle_t get() { return &d; }
};

}  // namespace libtest
