// ryacl: entries of two ACLs matched by type, mechanism and identity,
// without regard to letter case, in one hash table; the same pass finds
// the duplicates of each side.  A text that holds a key twice is refused
// with the library's duplicate message; a compiled ACL that does counts the
// first only, as evaluation finds the first.
#pragma once

#include <cstdint>
#include <vector>

#include "acl_load.h"

namespace ryacl {

class entry_matcher {
public:
    static constexpr uint32_t kNone = 0;
    static constexpr uint32_t kShadowed = UINT32_MAX;

    // `n` may be empty, to screen `o` alone.
    entry_matcher(const loaded_acl &o, const loaded_acl &n);
    // Match every entry.  0, or the return code of the first duplicate of
    // a text (OLD's first), with the library's message recorded.
    int32_t run();

    // Per OLD entry: its NEW match + 1, kNone, or kShadowed.
    std::vector<uint32_t> old_match;
    // Per NEW entry: true when it matched an OLD one or is shadowed.
    std::vector<bool> new_done;
    // Per OLD entry: true when its match grants other permissions (told
    // while both entries are at hand, so that the differences need not
    // visit the NEW entries again at random).
    std::vector<bool> old_changed;

private:
    int32_t add_side(int side);
    bool same(int sa, uint32_t a, int sb, uint32_t b) const;
    const acl_item *first_candidate(uint64_t h) const;

    const loaded_acl *acl_[2];
    std::vector<uint64_t> table_;        // tag << 33 | matched << 32 | (side << 31 | index) + 1; 0 empty
    uint64_t mask_ = 0;
};

}  // namespace ryacl
