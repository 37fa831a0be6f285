// Indexed evaluation: creating an index against validating the same buffer
// (the floor: creation validates too), and lookups through the index, hit
// and miss, for a user and for one group name, in sub-ACLs of 10^4 and 10^6
// entries.  Times are the fastest of the repetitions, reported as counters,
// with the page faults the fastest creation took (fresh pages are much of
// the cost of a large index).  A second floor is the copy of the buffer
// that every index owns (the caller may release the buffer): fresh memory
// advised into huge pages, as the index's is, filled with memcpy.
#include <benchmark/benchmark.h>
#include <sys/mman.h>
#include <sys/resource.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "ryacl.h"

namespace {

using clock_type = std::chrono::steady_clock;
using bytes = std::vector<unsigned char>;

void put(bytes &b, uint32_t v, int n) {
    for (int i = 0; i < n; ++i) b.push_back(static_cast<unsigned char>(v >> (8 * i)));
}

// Identifiers of 6 to 17 characters in mixed case, spread by a
// multiplicative step so neighbours share little.
std::string name(uint64_t i, const char *prefix) {
    uint64_t x = (i + 1) * 0x9e3779b97f4a7c15ull;
    std::string s = prefix;
    const size_t n = 4 + (x >> 60) % 12;
    for (size_t k = 0; k < n; ++k, x = x * 6364136223846793005ull + 1442695040888963407ull)
        s.push_back("abcdefghijklmnopqrstuvwxyzABCDEFGHIJ0123456789"[(x >> 33) % 46]);
    return s + std::to_string(i);
}

std::string folded(std::string s) {
    for (char &c : s)
        if (c >= 'A' && c <= 'Z') c = static_cast<char>(c + 32);
    return s;
}

// One sub-ACL of the given identifiers, laid down in ascending case-free
// order as the library's writer does.
bytes subacl(unsigned type, const char *mech, std::vector<std::string> ids) {
    std::sort(ids.begin(), ids.end(), [](const std::string &a, const std::string &b) { return folded(a) < folded(b); });
    bytes b(4, 0);
    b.push_back(static_cast<unsigned char>(type));
    put(b, static_cast<uint32_t>(ids.size()), 4);
    const size_t mlen = mech ? std::strlen(mech) + 1 : 0;
    b.push_back(static_cast<unsigned char>(mlen));
    if (mech) b.insert(b.end(), mech, mech + mlen);
    for (size_t i = 0; i < ids.size(); ++i) {
        b.push_back(1);
        put(b, static_cast<uint32_t>(1u << (i % 13)), 4);
        put(b, static_cast<uint32_t>(ids[i].size() + 1), 2);
        b.insert(b.end(), ids[i].c_str(), ids[i].c_str() + ids[i].size() + 1);
    }
    for (size_t i = 0; i < 4; ++i) b[i] = static_cast<unsigned char>(b.size() >> (8 * i));
    return b;
}

// An ACL with `n` user entries of mechanism unix and `n` group entries.
struct fixture {
    bytes acl;
    std::vector<std::string> users, groups;
};
const fixture &acl_of(long n) {
    static std::vector<std::pair<long, fixture>> made;
    for (auto &m : made)
        if (m.first == n) return m.second;
    fixture f;
    for (long i = 0; i < n; ++i) {
        f.users.push_back(name(static_cast<uint64_t>(i), "u"));
        f.groups.push_back(name(static_cast<uint64_t>(i), "g"));
    }
    const bytes u = subacl(SEC_ACLE_TYPE_USER, "unix", f.users), g = subacl(SEC_ACLE_TYPE_GROUP, nullptr, f.groups);
    f.acl = {0x85, 1, 2, 2, 0};
    f.acl.insert(f.acl.end(), u.begin(), u.end());
    f.acl.insert(f.acl.end(), g.begin(), g.end());
    made.emplace_back(n, std::move(f));
    return made.back().second;
}

long minor_faults() {
    rusage u{};
    getrusage(RUSAGE_SELF, &u);
    return u.ru_minflt;
}

double ns_since(clock_type::time_point t0) {
    return std::chrono::duration<double, std::nano>(clock_type::now() - t0).count();
}

// The copy an index holds, into memory as fresh as the index's: ns.
double fresh_copy_ns(const bytes &b) {
    constexpr size_t kHuge = size_t{2} << 20;
    const size_t n = (b.size() + kHuge - 1) / kHuge * kHuge;
    const auto t0 = clock_type::now();
    void *p = std::aligned_alloc(kHuge, n);
    if (!p) return 1e300;
    madvise(p, n, MADV_HUGEPAGE);
    std::memcpy(p, b.data(), b.size());
    benchmark::DoNotOptimize(p);
    benchmark::ClobberMemory();
    std::free(p);
    return ns_since(t0);
}

// Creation against validation of the same bytes, each timed alone and the
// fastest of the iterations kept.
void BM_CreateVsValidate(benchmark::State &state) {
    const fixture &f = acl_of(state.range(0));
    bytes copy = f.acl;
    sec_buffer_desc d{static_cast<int32_t>(copy.size()), copy.data()};
    double validate = 1e300, create = 1e300, copy_floor = 1e300;
    long faults = 0;  // page faults of the fastest creation
    for (auto _ : state) {
        auto t0 = clock_type::now();
        if (sec_convert_acl_to_host(1, &d) != 0) state.SkipWithError("validation failed");
        validate = std::min(validate, ns_since(t0));
        copy_floor = std::min(copy_floor, fresh_copy_ns(f.acl));
        sec_acl_index_t ix = nullptr;
        const long f0 = minor_faults();
        t0 = clock_type::now();
        if (sec_create_acl_index(&d, &ix) != 0) state.SkipWithError("creation failed");
        const double t = ns_since(t0);
        if (t < create) create = t, faults = minor_faults() - f0;
        sec_release_acl_index(ix);
    }
    const double entries = 2.0 * static_cast<double>(state.range(0));
    state.counters["validate_us"] = validate / 1e3;
    state.counters["create_us"] = create / 1e3;
    state.counters["create_ns_per_entry"] = create / entries;
    state.counters["create_vs_validate"] = create / validate;
    state.counters["create_faults"] = static_cast<double>(faults);
    state.counters["copy_us"] = copy_floor / 1e3;
    state.counters["create_vs_validate_and_copy"] = create / (validate + copy_floor);
}
BENCHMARK(BM_CreateVsValidate)->Arg(10000)->Arg(1000000)->ArgName("entries")->Unit(benchmark::kMillisecond)->MinTime(2.0);

// Lookups of 4096 identifiers spread over the sub-ACL (a miss is a present
// identifier with one character added), cycled; the fastest pass counts.
void BM_Lookup(benchmark::State &state) {
    const long n = state.range(0);
    const bool hit = state.range(1) != 0, group = state.range(2) != 0;
    const fixture &f = acl_of(n);
    sec_buffer_desc d{static_cast<int32_t>(f.acl.size()), const_cast<unsigned char *>(f.acl.data())};
    sec_acl_index_t ix = nullptr;
    if (sec_create_acl_index(&d, &ix) != 0) {
        state.SkipWithError("creation failed");
        return;
    }
    const std::vector<std::string> &src = group ? f.groups : f.users;
    std::vector<std::string> q;
    for (size_t i = 0; i < 4096; ++i) {
        const size_t k = (i * 2654435761u) % src.size();
        q.push_back(hit ? src[k] : src[k] + "x");
    }
    const int32_t want = hit ? 0 : ACL_RC_BAD_ACLE;
    double best = 1e300;
    for (auto _ : state) {
        const auto t0 = clock_type::now();
        for (const std::string &id : q) {
            uint32_t perm = 0;
            int32_t rc;
            if (group) {
                sec_buffer_desc g{0, const_cast<char *>(id.c_str())};
                rc = sec_index_group_acles_perm(ix, 1, &g, &perm);
            } else {
                rc = sec_index_single_acle_perm(ix, SEC_ACLE_TYPE_USER, "unix", nullptr, id.c_str(), &perm);
            }
            if (rc != want) state.SkipWithError("wrong answer");
            benchmark::DoNotOptimize(perm);
        }
        best = std::min(best, ns_since(t0) / static_cast<double>(q.size()));
    }
    state.counters["ns_per_lookup"] = best;
    sec_release_acl_index(ix);
}
BENCHMARK(BM_Lookup)
    ->ArgsProduct({{10000, 1000000}, {1, 0}, {0, 1}})
    ->ArgNames({"entries", "hit", "group"});

}  // namespace

BENCHMARK_MAIN();
