// The library's trace component "_SEL": registration with the trace
// facility, once per process, and the helpers its trace points use.
#include "ryacl_trace.h"

#include <errno.h>

#include <cstring>

#include "ry_zo.h"
#include "ryacl.h"

namespace {
constexpr const char kComponent[] = "_SEL";
constexpr uint32_t kCategoryCount = 5;
constexpr int64_t kNsPerSec = 1000000000;

// Converts counter values to time; written once, during registration.
zo_timeinfo timeinfo;

void register_once() { (void)acl__trace_register_component(); }
}  // namespace

extern "C" {

tr_category_description_t acl__trace_categories[5] = {
    {0, "Errors", 0, 0}, {1, "Info", 0, 0}, {2, "API", 0, 0}, {3, "Buffer", 0, 0}, {4, "Perf", 0, 0},
};
tr_detail_level_t acl__trace_detail_levels[5];
pthread_once_t acl__trace_register_once = PTHREAD_ONCE_INIT;

int32_t acl__trace_register_component(void) {
    static_assert(sizeof acl__trace_detail_levels / sizeof acl__trace_detail_levels[0] == kCategoryCount,
                  "one detail level per category");
    const int saved_errno = errno;
    // Registration runs inside whatever operation first reaches a trace
    // point; keep the error that operation may be about to report.  If the
    // copy cannot be made the slot is left alone (the trace facility never
    // writes it), rather than cleared by restoring nothing.
    zo_error_t *saved = nullptr;
    const bool have_copy = zo_get_error_1(&saved) == 0;
    int32_t rc = tr_register_component_1(kComponent, acl__trace_detail_levels, acl__trace_categories,
                                         kCategoryCount);
    if (have_copy) {
        zo_pset_error_1(saved);
        zo_rel_error_1(saved);
    }

    zo_get_procspeed_1(&timeinfo);

    const tr_detail_level_t perf = acl__trace_detail_levels[acl::trace::PERF];
    if (perf == 1 || perf == 2 || perf == 3 || perf == 4 || perf == 7 || perf == 8) {
        char name[257] = {};
        if (tr_get_filename_1(name) != 0) std::strcpy(name, "unknown");
        int32_t size = 0;
        tr_get_size_1(&size);
        uint32_t level = perf;
        tr_record_data_1(kComponent, 0, 1, static_cast<const void *>(&level), sizeof level);
    }
    errno = saved_errno;
    return rc;
}

RYACL_API int32_t acl__trace_unregister_component(void) {
    return tr_unregister_component_1(kComponent);
}

}  // extern "C"

namespace acl::trace {

std::atomic<bool> registered{false};

void ensure_registered() {
    // pthread_once leaves errno alone on success; nothing to guard here.
    pthread_once(&acl__trace_register_once, register_once);
    registered.store(true, std::memory_order_release);
}

item strn(const char *s, size_t max, const char *absent) {
    if (!s) {
        s = absent ? absent : "";
        return item{s, std::strlen(s) + 1};
    }
    const void *nul = std::memchr(s, '\0', max);
    size_t n = nul ? static_cast<size_t>(static_cast<const char *>(nul) - s) + 1 : max;
    return item{s, n};
}

namespace {
tr_item_t to_tr(const item &i) {
    if (i.n == kTextToMeasure) return tr_item_t{i.p, std::strlen(static_cast<const char *>(i.p)) + 1};
    return tr_item_t{i.p, i.n};
}
}  // namespace

void record_id(uint32_t id) { tr_record_id_1(kComponent, id); }

void record_data(uint32_t id, std::initializer_list<item> items) {
    // item and tr_item_t have the same members; copy rather than cast so the
    // two types stay free to differ.
    tr_item_t v[32];
    uint32_t n = 0;
    for (const item &i : items) {
        if (n == sizeof v / sizeof v[0]) break;
        v[n++] = to_tr(i);
    }
    tr_record_datav_1(kComponent, id, n, v);
}

void api_entry_on(uint32_t id, uint32_t data_id, std::initializer_list<item> data) {
    tr_detail_level_t lv = level(API);
    if (lv == 1) record_id(id);
    else if (lv >= 8) record_data(data_id, data);
}

void api_exit_on(uint32_t id, uint32_t rc_id, int32_t rc) {
    tr_detail_level_t lv = level(API);
    if (lv == 1) record_id(id);
    else if (lv >= 8) record_data(rc_id, {val(rc)});
}

void api_exit(uint32_t id, uint32_t rc_id, uint32_t result_id, int32_t rc,
              std::initializer_list<item> results) {
    tr_detail_level_t lv = level(API);
    if (lv == 1) {
        record_id(id);
    } else if (lv >= 8) {
        if (rc != 0) {
            record_data(rc_id, {val(rc)});
            return;
        }
        tr_item_t v[32];
        uint32_t n = 0;
        v[n++] = tr_item_t{&rc, sizeof rc};
        for (const item &i : results) {
            if (n == sizeof v / sizeof v[0]) break;
            v[n++] = to_tr(i);
        }
        tr_record_datav_1(kComponent, result_id, n, v);
    }
}

void api_release_exit(uint32_t id) {
    if (level(API) != 0) record_id(id);
}

void point_on(category c, uint32_t id, std::initializer_list<item> data) {
    tr_detail_level_t lv = level(c);
    if (lv == 0) return;
    // Two Info points have levels of their own: 107 (cache file in use) only
    // at 1, and 114 (every parsed entry, bulky) only above 7.
    if (c == INFO && id == 107 && lv != 1) return;
    if (c == INFO && id == 114 && lv <= 7) return;
    if (data.size() == 0) record_id(id);
    else record_data(id, data);
}

void elapsed(uint64_t sec0, uint64_t nsec0, uint64_t sec1, uint64_t nsec1, int64_t *sec, int64_t *nsec) {
    int64_t s = static_cast<int64_t>(sec1 - sec0);
    int64_t ns = static_cast<int64_t>(nsec1) - static_cast<int64_t>(nsec0);
    if (ns < 0) {
        s -= 1;
        ns += kNsPerSec;
    }
    *sec = s;
    *nsec = ns;
}

perf_timer::perf_timer(uint8_t perf_level) {
    armed_ = level(PERF) == perf_level;
    if (armed_) zo_get_ctr_1(&start_);
}

void perf_timer::record(uint32_t id, std::initializer_list<item> prefix) {
    if (!armed_) return;
    uint64_t end = 0;
    zo_get_ctr_1(&end);
    uint64_t s0 = 0, ns0 = 0, s1 = 0, ns1 = 0;
    zo_cvt_time_1(start_, &timeinfo, &s0, &ns0);
    zo_cvt_time_1(end, &timeinfo, &s1, &ns1);
    uint64_t ticks = end - start_;
    int64_t sec = 0, nsec = 0;
    elapsed(s0, ns0, s1, ns1, &sec, &nsec);
    tr_item_t v[32];
    uint32_t n = 0;
    for (const item &i : prefix) {
        if (n == sizeof v / sizeof v[0] - 3) break;
        v[n++] = to_tr(i);
    }
    v[n++] = tr_item_t{&ticks, sizeof ticks};
    v[n++] = tr_item_t{&sec, sizeof sec};
    v[n++] = tr_item_t{&nsec, sizeof nsec};
    tr_record_datav_1(kComponent, id, n, v);
}

}  // namespace acl::trace
