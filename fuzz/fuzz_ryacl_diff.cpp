// ryacl's loader and entry matcher, as diff uses them, on two arbitrary
// inputs.  Input: two bytes (little-endian) giving the length of the first
// input, its bytes, then the second's; each is text or a compiled ACL, as
// the loader decides from its first bytes.
//
// Each input sits in a block of its own size and the zero byte the file
// reader puts after it, so the sanitizers see any read outside it.  Loading
// the same bytes twice gives the same code and entries.  Matching an input
// with itself finds no difference; matching A with B refuses exactly when
// matching B with A does, and otherwise B's entries added are those removed
// the other way round, A's removed those added, and the pairs matched are
// the same pairs.  Every entry is written out as diff writes it.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <set>
#include <string>
#include <tuple>
#include <utility>

#include "acl_load.h"
#include "acl_match.h"
#include "ry_zo.h"

namespace {

using ryacl::entry_matcher;
using ryacl::loaded_acl;

[[noreturn]] void fail(const char *what) {
    std::fprintf(stderr, "fuzz_ryacl_diff: %s\n", what);
    std::abort();
}
void expect(bool ok, const char *what) {
    if (!ok) fail(what);
}

// 0 and the entries, or the code of the first fault (a duplicate of a text
// among them, as the command screens it).
int32_t load(const uint8_t *data, size_t size, loaded_acl &out) {
    out.path = "fuzz";
    out.bytes = static_cast<char *>(std::malloc(size + 1));
    if (!out.bytes) fail("out of memory");
    if (size) std::memcpy(out.bytes, data, size);
    out.bytes[size] = '\0';
    out.nbytes = size;
    if (int32_t rc = ryacl::add_file_bytes(false, out)) return rc;
    const loaded_acl none;
    entry_matcher alone(out, none);
    return alone.run();
}

// One direction's outcome: OLD's entries removed, NEW's added, and the
// matched pairs (OLD index, NEW index), changed or not.
struct outcome {
    int32_t rc = 0;
    std::set<uint32_t> removed, added;
    std::set<std::pair<uint32_t, uint32_t>> pairs;
    size_t changed = 0;
};

outcome compare(const loaded_acl &o, const loaded_acl &n) {
    outcome r;
    entry_matcher m(o, n);
    r.rc = m.run();
    if (r.rc) return r;
    expect(m.old_match.size() == o.items.size(), "a match per OLD entry");
    expect(m.new_done.size() == n.items.size(), "a mark per NEW entry");
    for (uint32_t i = 0; i < o.items.size(); ++i) {
        const uint32_t j = m.old_match[i];
        if (j == entry_matcher::kShadowed) continue;
        if (j == entry_matcher::kNone) {
            r.removed.insert(i);
            continue;
        }
        expect(j - 1 < n.items.size(), "a match within NEW");
        expect(m.new_done[j - 1], "a matched NEW entry is marked");
        expect(o.items[i].type == n.items[j - 1].type, "a match of the same type");
        r.pairs.insert({i, j - 1});
        r.changed += o.items[i].perm != n.items[j - 1].perm;
        expect(m.old_changed[i] == (o.items[i].perm != n.items[j - 1].perm), "a changed pair is marked as one");
    }
    for (uint32_t j = 0; j < n.items.size(); ++j)
        if (!m.new_done[j]) r.added.insert(j);
    return r;
}

std::set<std::pair<uint32_t, uint32_t>> swapped(const std::set<std::pair<uint32_t, uint32_t>> &s) {
    std::set<std::pair<uint32_t, uint32_t>> out;
    for (const auto &[a, b] : s) out.insert({b, a});
    return out;
}

void write_out(const loaded_acl &acl) {
    size_t total = 0;
    for (const ryacl::acl_item &e : acl.items) {
        expect(!e.id || std::strlen(e.id) == e.idlen, "an identity's length");
        total += ryacl::entry_text(e).size() + ryacl::entry_text(e, false).size();
        total += std::strlen(ryacl::type_word(e.type));
    }
    expect(total >= acl.items.size(), "an entry written out");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size < 2) return 0;
    size_t first = static_cast<size_t>(data[0] | data[1] << 8);
    data += 2;
    size -= 2;
    if (first > size) first = size;

    loaded_acl a, a2, b, b2;
    const int32_t rca = load(data, first, a), rca2 = load(data, first, a2);
    const int32_t rcb = load(data + first, size - first, b), rcb2 = load(data + first, size - first, b2);
    expect(rca == rca2 && rcb == rcb2, "the same bytes load alike");
    expect(a.items.size() == a2.items.size(), "the same bytes give as many entries");
    write_out(a);
    write_out(b);
    for (const auto &[x, x2, rc] : {std::tuple<loaded_acl *, loaded_acl *, int32_t>{&a, &a2, rca}, {&b, &b2, rcb}}) {
        if (rc) continue;
        const outcome self = compare(*x, *x2);
        expect(self.rc == 0, "an input that loads matches itself");
        expect(self.removed.empty(), "nothing removed from an input itself");
        expect(self.added.empty(), "nothing added to an input itself");
        expect(self.changed == 0, "nothing changed in an input itself");
    }
    // A faulty input leaves the entries before its fault; diff refuses it
    // before matching, but the matcher must still stay within them.
    const outcome ab = compare(a, b), ba = compare(b, a);
    expect((ab.rc == 0) == (ba.rc == 0), "a refusal both ways or neither");
    if (ab.rc == 0 && ba.rc == 0) {
        expect(ab.added == ba.removed, "added one way is removed the other");
        expect(ab.removed == ba.added, "removed one way is added the other");
        expect(ab.pairs == swapped(ba.pairs), "the same pairs both ways");
        expect(ab.changed == ba.changed, "as many changed both ways");
    }
    return 0;
}
