// Reading a compiled ACL within its block: the layout's constants, its
// field loads and stores, and two cursors, one over the sub-ACLs of a
// buffer and one over the entries of a sub-ACL.  Every reader of compiled
// ACLs walks through these, so each bound is tested in one place: a count
// or a length from outside may lie, and a cursor says so instead of
// reading past the block.
//
// What the bytes mean, for every reader:
//  - Sub-ACLs follow each other by their length fields from offset 5, as
//    many as the header counts.  No length runs past the end of the block.
//  - A sub-ACL's entries are where its count and their identifier lengths
//    put them.  Validation holds every sub-ACL but the last to its length
//    (the next must begin where its entries end); the last one's length is
//    compared with nothing, so in a buffer that passed validation it may be
//    shorter or longer than its entries, down to 0.
//  - Hence, on a validated buffer, every operation agrees on the entries
//    found by count and identifier lengths, bounded by the end of the block
//    and never by the last sub-ACL's length field: the search finds the last
//    sub-ACL whatever its length, listing and evaluation read its entries,
//    the dump prints them (showing the length field as it stands), and an
//    edit returns what it returns on the same ACL written out exactly and
//    leaves a valid buffer holding the edited entries.  An edit writes the
//    last sub-ACL back exactly in place of its bytes up to whichever ends
//    later, its length or its entries; a new sub-ACL goes right after the
//    last one's entries, and that one's length is made exact.  Bytes past
//    the walk stay there, where validation never looks.
#pragma once

#include <bit>
#include <cstddef>
#include <cstdint>
#include <cstring>

#define ACL_BUF_TYPE 0x85
#define ACL_BUF_VERSION 1
#define ACL_BUF_HOST_ORDER 2
#define ACL_HDR_SIZE 5
#define ACL_SUBACL_HDR_SIZE 10  // without the mechanism
#define ACL_ENTRY_HDR_SIZE 7    // without the identifier
#define ACL_MAX_SUBACLS 65535u
#define ACL_MAX_IDLEN 65534u    // identifier bytes, its NUL not counted

// Byte ordering 2 names the host's order, which is little-endian on every
// target this library is built for.
static_assert(std::endian::native == std::endian::little, "byte ordering 2 is little-endian");

inline uint16_t acl__load_le16(const unsigned char *p) {
    uint16_t v;
    std::memcpy(&v, p, sizeof v);
    return v;
}
inline uint32_t acl__load_le32(const unsigned char *p) {
    uint32_t v;
    std::memcpy(&v, p, sizeof v);
    return v;
}
inline void acl__store_le16(unsigned char *p, uint16_t v) { std::memcpy(p, &v, sizeof v); }
inline void acl__store_le32(unsigned char *p, uint32_t v) { std::memcpy(p, &v, sizeof v); }

// Whether n bytes at pos lie before end (pos itself may lie beyond).
constexpr bool acl__fits(size_t pos, size_t n, size_t end) { return pos <= end && n <= end - pos; }

// How a cursor reads a multi-byte field: as it stands, or reversed in place
// first.  A walk reads each field once, so byte-order conversion is a walk
// with the reversing reader.
struct acl__read_host {
    using byte = const unsigned char;
    static uint16_t u16(byte *p) { return acl__load_le16(p); }
    static uint32_t u32(byte *p) { return acl__load_le32(p); }
};
struct acl__read_reversing {
    using byte = unsigned char;
    static uint16_t u16(byte *p) {
        const uint16_t v = __builtin_bswap16(acl__load_le16(p));
        acl__store_le16(p, v);
        return v;
    }
    static uint32_t u32(byte *p) {
        const uint32_t v = __builtin_bswap32(acl__load_le32(p));
        acl__store_le32(p, v);
        return v;
    }
};

// One sub-ACL as a cursor found it: its 10-byte header lies in the block.
struct acl__subacl {
    size_t off = 0;       // of its first byte in the block
    size_t avail = 0;     // bytes from there to the end of the block
    uint32_t length = 0;  // its length field, at most avail
    uint32_t count = 0;   // its entry count
    unsigned char type = 0;
    unsigned char mechlen = 0;
    bool last = false;  // the last one the header counts

    // The bytes it may hold: its length, but the last one's length is not
    // consulted: up to the end of the block.
    size_t room() const { return last ? avail : length; }
    size_t end() const { return off + room(); }
    // Where its first entry begins; past end() when the mechanism field
    // runs off its room.
    size_t entries() const { return off + ACL_SUBACL_HDR_SIZE + mechlen; }
    bool header_fits() const { return acl__fits(ACL_SUBACL_HDR_SIZE, mechlen, room()); }
};

// A sub-ACL handed over on its own with the `avail` bytes that follow its
// start (at least its 10-byte header), read as the last of a buffer: its
// room is those bytes, whatever its length field says.
inline acl__subacl acl__subacl_alone(const unsigned char *p, size_t avail) {
    acl__subacl s;
    s.avail = avail;
    s.length = acl__load_le32(p);
    s.type = p[4];
    s.count = acl__load_le32(p + 5);
    s.mechlen = p[9];
    s.last = true;
    return s;
}

// Strict: a sub-ACL that is not the last must cover its own 10-byte header,
// or it is not yielded at all (the search, listing, edits).  Lenient: it is
// yielded and the walk breaks when stepping past it (validation and
// conversion check a sub-ACL's own rules first; the dump shows it).
enum class acl__walk { strict, lenient };

template <class Read = acl__read_host>
class acl__subacl_cursor {
public:
    using byte = typename Read::byte;
    // `len` covers at least the 5-byte header; the sub-ACL count is read at once.
    acl__subacl_cursor(byte *base, size_t len, acl__walk mode = acl__walk::strict)
        : base_(base), len_(len), nsub_(Read::u16(base + 3)), mode_(mode) {}

    // 1: *s is the next counted sub-ACL; 0: every one was visited; -1: the
    // next cannot be located (its header or length runs past the block, or
    // the length of the one before does not cover that one's header), nor
    // any after it.
    int next(acl__subacl *s) {
        if (broken_) return -1;
        if (k_ == nsub_) return 0;
        if (k_ > 0) {
            if (!steps(prev_len_)) return fail();
            pos_ += prev_len_;
        }
        if (!acl__fits(pos_, ACL_SUBACL_HDR_SIZE, len_)) return fail();
        byte *p = base_ + pos_;
        const uint32_t length = Read::u32(p);
        if (length > len_ - pos_) return fail();
        s->off = pos_;
        s->avail = len_ - pos_;
        s->length = length;
        s->type = p[4];
        s->count = Read::u32(p + 5);
        s->mechlen = p[9];
        s->last = ++k_ == nsub_;
        prev_len_ = length;
        if (mode_ == acl__walk::strict && !s->last && !steps(length)) return fail();
        return 1;
    }

private:
    // A shorter length would lead the walk back into the same header.
    static bool steps(size_t length) { return length >= ACL_SUBACL_HDR_SIZE; }
    int fail() {
        broken_ = true;
        return -1;
    }

    byte *base_;
    size_t len_;
    unsigned nsub_;
    acl__walk mode_;
    unsigned k_ = 0;
    size_t pos_ = ACL_HDR_SIZE;
    size_t prev_len_ = 0;
    bool broken_ = false;
};

// One entry as a cursor found it: its 7-byte header lies within the bound.
struct acl__entry {
    size_t off = 0;  // of its first byte in the block
    unsigned char version = 0;
    uint32_t perm = 0;
    uint16_t idlen = 0;        // the identifier length field
    const char *id = nullptr;  // the identifier field; null when it runs past the bound
};

// The entries of one sub-ACL, as many as it counts, each where the one
// before ended, none read past `end`: the sub-ACL's end() (strict) or the
// end of the block (lenient).
template <class Read = acl__read_host>
class acl__entry_cursor {
public:
    using byte = typename Read::byte;
    acl__entry_cursor(byte *base, const acl__subacl &s, size_t end)
        : base_(base), pos_(s.entries()), end_(end), left_(s.count) {}

    // Whether the mechanism field, hence the first entry's place, lies within the bound.
    bool started() const { return pos_ <= end_; }
    // Where the entries walked so far end.
    size_t pos() const { return pos_; }

    // 1: *e is the next entry, its header within the bound (its identifier
    // field may not be: e->id is then null); 0: the count is used up; -1:
    // the header runs past the bound.
    int next_header(acl__entry *e) {
        if (left_ == 0) return 0;
        if (!acl__fits(pos_, ACL_ENTRY_HDR_SIZE, end_)) return -1;
        byte *p = base_ + pos_;
        e->off = pos_;
        e->version = p[0];
        e->perm = Read::u32(p + 1);
        e->idlen = Read::u16(p + 5);
        const bool fits = e->idlen <= end_ - pos_ - ACL_ENTRY_HDR_SIZE;
        e->id = fits ? reinterpret_cast<const char *>(p + ACL_ENTRY_HDR_SIZE) : nullptr;
        pos_ += ACL_ENTRY_HDR_SIZE + size_t{e->idlen};
        --left_;
        return 1;
    }
    // The same, the whole entry within the bound (-1 otherwise).
    int next(acl__entry *e) {
        const int r = next_header(e);
        return r == 1 && !e->id ? -1 : r;
    }

private:
    byte *base_;
    size_t pos_;
    size_t end_;
    uint32_t left_;
};
