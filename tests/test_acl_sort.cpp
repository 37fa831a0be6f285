// Ordering identifiers: the radix passes and the multikey quicksort against
// a plain stable sort under the folded compare, ties beyond the twelve
// bytes a key holds included.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstdlib>
#include <numeric>
#include <random>
#include <string>
#include <vector>

#include "ry_zo_int.h"
#include "ryacl_acl_sort.h"

namespace {

struct ref {
    uint32_t off, len;
};

// The order the sort makes, for identifiers given in entry order.
std::vector<uint32_t> sorted_by_sort(const std::vector<std::string> &ids) {
    std::string arena;
    std::vector<ref> refs;
    for (const std::string &s : ids) {
        refs.push_back({static_cast<uint32_t>(arena.size()), static_cast<uint32_t>(s.size())});
        arena += s;
        arena += '\0';
    }
    auto *keys = static_cast<acl__sort_key *>(std::malloc(acl__sort_area_bytes(ids.size())));
    for (size_t j = 0; j < ids.size(); ++j) keys[j].i = static_cast<uint32_t>(j);
    acl__sort_ids(keys, ids.size(), {arena.data(), refs.data(), sizeof(ref)});
    std::vector<uint32_t> out;
    for (size_t j = 0; j < ids.size(); ++j) out.push_back(keys[j].i);
    std::free(keys);
    return out;
}

// The same by the byte-wise folded compare, equal texts in entry order.
std::vector<uint32_t> sorted_plainly(const std::vector<std::string> &ids) {
    std::vector<uint32_t> out(ids.size());
    std::iota(out.begin(), out.end(), 0u);
    std::stable_sort(out.begin(), out.end(), [&](uint32_t a, uint32_t b) {
        return zo_strcasecmp_posix_1(ids[a].c_str(), ids[b].c_str()) < 0;
    });
    return out;
}

// n identifiers over a small alphabet (letters of both cases, punctuation
// that sorts between the cases, a byte above 0x7f), sharing a prefix of
// `shared` bytes, so that many tie through a key's twelve bytes and past
// it, some equal but for case, some prefixes of others.
std::vector<std::string> identifiers(size_t n, size_t shared, unsigned seed) {
    static const char alphabet[] = "aAbB_[\xc3";
    std::mt19937 rng(seed);
    const std::string prefix(shared, 'u');
    std::vector<std::string> ids;
    for (size_t i = 0; i < n; ++i) {
        std::string s = prefix;
        const size_t extra = rng() % 5;
        for (size_t k = 0; k < extra; ++k) s += alphabet[rng() % (sizeof alphabet - 1)];
        ids.push_back(s);
    }
    return ids;
}

TEST(AclSort, AgreesWithTheFoldedCompareAndKeepsEntryOrderOnTies) {
    // Below the radix pass's smallest range, above it, and large enough
    // for ranges to be split at several depths and moved back and forth
    // between the two halves of the work area; prefixes that end before,
    // at and beyond the twelve bytes of a key.
    // 40,000 are distributed on two bytes at once, first beyond the cache,
    // then within it, texts ending inside either byte.
    for (size_t n : {2u, 17u, 63u, 300u, 5000u, 40000u})
        for (size_t shared : {0u, 7u, 11u, 12u, 13u, 17u, 30u}) {
            const std::vector<std::string> ids = identifiers(n, shared, static_cast<unsigned>(n + shared));
            EXPECT_EQ(sorted_by_sort(ids), sorted_plainly(ids)) << n << " identifiers, prefix " << shared;
        }
}

TEST(AclSort, TwoBytePassesThatDoNotPay) {
    std::mt19937 rng(5);
    auto any_bytes = [&](std::string &s, size_t most) {
        for (size_t k = rng() % (most + 1); k > 0; --k) s += static_cast<char>(1 + rng() % 255);
    };
    // The first two bytes take over a thousand values: too many for one
    // pass over a range beyond the cache, which goes one byte at a time;
    // within each of its ranges the next two take few enough for one.
    std::vector<std::string> spread;
    for (size_t i = 0; i < 200000; ++i) {
        std::string s{("aBc[\xc3xYz0~m\x7f" "12345678")[rng() % 20], static_cast<char>(1 + rng() % 64), "qQ_"[rng() % 3]};
        any_bytes(s, 3);
        spread.push_back(s);
    }
    EXPECT_EQ(sorted_by_sort(spread), sorted_plainly(spread)) << "two bytes of thousands of values";

    // Within each range of a two-byte pass, the next two bytes (and no
    // more) are the same in every key.
    std::vector<std::string> shared_pair;
    for (size_t i = 0; i < 40000; ++i) {
        std::string s = std::string("u") + "aBc[\xc3xYz"[rng() % 8] + "cDe";
        any_bytes(s, 4);
        shared_pair.push_back(s);
    }
    EXPECT_EQ(sorted_by_sort(shared_pair), sorted_plainly(shared_pair)) << "a shared pair of bytes";
}

TEST(AclSort, ManyEqualTextsAndOrderedInputs) {
    // Equal under folding, differing only in case far beyond twelve bytes:
    // entry order throughout.
    std::vector<std::string> same;
    for (int i = 0; i < 2000; ++i)
        same.push_back(std::string(40, 'x') + (i % 2 ? "CASE" : "case") + std::string(i % 3, 'z'));
    EXPECT_EQ(sorted_by_sort(same), sorted_plainly(same));

    // Already ascending and descending, the inputs that defeat a naive pivot.
    std::vector<std::string> up;
    for (int i = 0; i < 3000; ++i) {
        char b[32];
        std::snprintf(b, sizeof b, "user%020d", i);
        up.push_back(b);
    }
    EXPECT_EQ(sorted_by_sort(up), sorted_plainly(up));
    std::reverse(up.begin(), up.end());
    EXPECT_EQ(sorted_by_sort(up), sorted_plainly(up));
}

}  // namespace
