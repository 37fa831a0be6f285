// The fuzz targets' plain model of an ACL: its entries grouped by sub-ACL,
// the bytes a compiled ACL of those entries must have, and the list the
// listing operations must return.  Written from the layout alone, without
// the library's trees or writers, so the two can be held against each other.
#pragma once

#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <utility>
#include <vector>

#include "ry_zo.h"
#include "ryacl.h"

namespace fuzzmodel {

// The message number the last failing call recorded (0 when none).
inline int32_t current_msgnum() {
    zo_error_t *rec = nullptr;
    zo_get_error_1(&rec);
    int32_t n = rec ? rec->zo_msg_num : 0;
    zo_rel_error_1(rec);
    return n;
}

// The stream failed checks are reported on: the process's standard error
// as it was before quiet_library_streams.
inline FILE *&report_stream() {
    static FILE *real = stderr;
    return real;
}

// The dumps and a failed sub-ACL read write on the standard streams; the
// library's writes go to /dev/null from the first call on, while reports of
// failed checks and the sanitizers keep descriptor 2.
inline void quiet_library_streams() {
    static bool done = false;
    if (done) return;
    done = true;
    report_stream() = stderr;
    if (FILE *null = std::fopen("/dev/null", "w")) {
        stdout = null;
        stderr = null;
    }
}

// A failed check ends the run with a message libFuzzer keeps beside the input.
[[noreturn]] inline void fail(const char *what, const char *file, int line) {
    std::fprintf(report_stream(), "fuzz check failed at %s:%d: %s\n", file, line, what);
    std::fflush(report_stream());
    std::abort();
}
#define FUZZ_CHECK(cond) \
    do { if (!(cond)) ::fuzzmodel::fail(#cond, __FILE__, __LINE__); } while (0)

// Only A to Z fold, as the library's POSIX-locale comparison does.
inline std::string folded(const std::string &s) {
    std::string f = s;
    for (char &c : f)
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c + 32);
    return f;
}

inline bool has_mech(unsigned t) { return t == SEC_ACLE_TYPE_USER || t == SEC_ACLE_TYPE_EXPANDED; }
inline bool has_id(unsigned t) { return has_mech(t) || t == SEC_ACLE_TYPE_GROUP; }

struct entry {
    std::string id;  // the spelling stored first
    uint32_t perm = 0;
    std::string fid;  // folded id, the entry's identity within its sub-ACL
    entry(std::string i, uint32_t p) : id(std::move(i)), perm(p), fid(folded(id)) {}
};

struct subacl {
    unsigned char type = 0;
    std::string mech;  // spelling carried by the sub-ACL ("" for types 1, 2, 16)
    std::vector<entry> entries;  // in insertion order

    bool holds(unsigned char t, const std::string &m) const {
        return type == t && (!has_mech(t) || folded(mech) == folded(m));
    }
    entry *find(const std::string &id) {
        const std::string f = folded(id);
        for (entry &e : entries)
            if (!has_id(type) || e.fid == f) return &e;
        return nullptr;
    }
    // Entries as a writer lays them down: ascending folded identifier for
    // user and group sub-ACLs (std::string compares bytes unsigned, like the
    // library's comparison), insertion order otherwise.
    std::vector<const entry *> ordered() const {
        std::vector<const entry *> v;
        for (const entry &e : entries) v.push_back(&e);
        if (type == SEC_ACLE_TYPE_USER || type == SEC_ACLE_TYPE_GROUP)
            std::stable_sort(v.begin(), v.end(),
                             [](const entry *a, const entry *b) { return a->fid < b->fid; });
        return v;
    }
};

struct acl {
    std::vector<subacl> subs;  // in the order kept by the model's owner

    subacl *find(unsigned char type, const std::string &mech) {
        for (subacl &s : subs)
            if (s.holds(type, mech)) return &s;
        return nullptr;
    }
    size_t count() const {
        size_t n = 0;
        for (const subacl &s : subs) n += s.entries.size();
        return n;
    }
};

inline void put16(std::vector<unsigned char> &b, uint32_t v) {
    b.push_back(static_cast<unsigned char>(v));
    b.push_back(static_cast<unsigned char>(v >> 8));
}
inline void put32(std::vector<unsigned char> &b, uint32_t v) {
    for (int i = 0; i < 4; ++i) b.push_back(static_cast<unsigned char>(v >> (8 * i)));
}

// The compiled ACL of the model, sub-ACLs in the given order of indices.
inline std::vector<unsigned char> compile(const acl &m, const std::vector<size_t> &order) {
    std::vector<unsigned char> b{0x85, 0x01, 0x02};
    put16(b, static_cast<uint32_t>(order.size()));
    for (size_t k : order) {
        const subacl &s = m.subs[k];
        const size_t start = b.size();
        put32(b, 0);
        b.push_back(s.type);
        put32(b, static_cast<uint32_t>(s.entries.size()));
        b.push_back(static_cast<unsigned char>(has_mech(s.type) ? s.mech.size() + 1 : 0));
        if (has_mech(s.type)) b.insert(b.end(), s.mech.c_str(), s.mech.c_str() + s.mech.size() + 1);
        for (const entry *e : s.ordered()) {
            b.push_back(1);
            put32(b, e->perm);
            put16(b, has_id(s.type) ? static_cast<uint32_t>(e->id.size() + 1) : 0);
            if (has_id(s.type)) b.insert(b.end(), e->id.c_str(), e->id.c_str() + e->id.size() + 1);
        }
        const uint32_t len = static_cast<uint32_t>(b.size() - start);
        for (int i = 0; i < 4; ++i) b[start + static_cast<size_t>(i)] = static_cast<unsigned char>(len >> (8 * i));
    }
    return b;
}

inline std::vector<size_t> in_order(const acl &m) {
    std::vector<size_t> v(m.subs.size());
    for (size_t i = 0; i < v.size(); ++i) v[i] = i;
    return v;
}

inline bool same_bytes(const sec_buffer_desc &d, const std::vector<unsigned char> &b) {
    return d.length >= 0 && static_cast<size_t>(d.length) == b.size() && d.value &&
           std::memcmp(d.value, b.data(), b.size()) == 0;
}

// One listed entry as the model expects it.
struct listed {
    unsigned char type;
    std::string mech;
    std::string id;
    uint32_t perm;
    bool operator==(const listed &o) const {
        return type == o.type && mech == o.mech && id == o.id && perm == o.perm;
    }
};

inline void append_listed(const subacl &s, std::vector<listed> &out) {
    for (const entry *e : s.ordered())
        out.push_back({s.type, has_mech(s.type) ? s.mech : "", has_id(s.type) ? e->id : "", e->perm});
}

// What a list holds, read through its records; an entry record must be
// whole: a known type, a terminated mechanism and an identifier exactly
// where the type has one.
inline std::vector<listed> read_list(const sec_acle_list_desc &l) {
    std::vector<listed> v;
    FUZZ_CHECK(l.count >= 0);
    FUZZ_CHECK((l.count == 0) == (l.acles == nullptr));
    for (int32_t i = 0; i < l.count; ++i) {
        const sec_acle_desc *a = l.acles[i];
        FUZZ_CHECK(a != nullptr);
        FUZZ_CHECK(memchr(a->mech, '\0', sizeof a->mech) != nullptr);
        FUZZ_CHECK(has_id(a->type) == (a->id != nullptr));
        FUZZ_CHECK(has_mech(a->type) == (a->mech[0] != '\0'));
        v.push_back({a->type, a->mech, a->id ? a->id : "", a->perm});
    }
    return v;
}

}  // namespace fuzzmodel
