// The library's trace component "_SEL": five categories, detail levels kept
// current by the trace facility, and the helpers every trace point uses.
// A point that is off costs one once-check and one byte read.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <initializer_list>

#include "ry_zo_int.h"

#include <pthread.h>

extern "C" {
extern tr_category_description_t acl__trace_categories[5];
extern tr_detail_level_t acl__trace_detail_levels[5];
extern pthread_once_t acl__trace_register_once;
int32_t acl__trace_register_component(void);
}

namespace acl::trace {

enum category : unsigned { ERRORS = 0, INFO = 1, API = 2, BUFFER = 3, PERF = 4 };

// Run the registration once per process (pthread_once).
void ensure_registered();
// Set once the registration has run: after that the once-check is this one
// load, without a call into pthread_once on every trace point.
extern std::atomic<bool> registered;

inline tr_detail_level_t level(category c) {
    if (!registered.load(std::memory_order_acquire)) ensure_registered();
    return acl__trace_detail_levels[c];
}

// Whether any category records anything.
inline bool any_on() {
    for (auto c : {ERRORS, INFO, API, BUFFER, PERF})
        if (level(c)) return true;
    return false;
}

// One data item: an address and a length in bytes.
struct item {
    const void *p;
    size_t n;
};
// A text with its NUL; a null text is recorded as `absent` ("" by default).
// A terminated text is measured only when a point is recorded, so a trace
// point that is off never walks its texts.
inline constexpr size_t kTextToMeasure = static_cast<size_t>(-1);
inline item str(const char *s, const char *absent = "") {
    return item{s ? s : (absent ? absent : ""), kTextToMeasure};
}
// A text read from an area of `max` bytes that need not hold a NUL: never
// reads past the area.  Unterminated, it is recorded as raw bytes.
item strn(const char *s, size_t max, const char *absent = "");
template <class T>
inline item val(const T &v) { return item{&v, sizeof v}; }

void record_id(uint32_t id);
void record_data(uint32_t id, std::initializer_list<item> items);

// "API" category points.  Entry: level 1 records `id`, level 8 records
// `data_id` with the data.  Exit: level 1 records `id`, level 8 records
// `rc_id` with the return code, or, on success when results are given,
// `result_id` with the return code and the results.
void api_entry_on(uint32_t id, uint32_t data_id, std::initializer_list<item> data);
inline void api_entry(uint32_t id, uint32_t data_id, std::initializer_list<item> data) {
    if (level(API)) api_entry_on(id, data_id, data);
}
void api_exit_on(uint32_t id, uint32_t rc_id, int32_t rc);
inline void api_exit(uint32_t id, uint32_t rc_id, int32_t rc) {
    if (level(API)) api_exit_on(id, rc_id, rc);
}
void api_exit(uint32_t id, uint32_t rc_id, uint32_t result_id, int32_t rc,
              std::initializer_list<item> results);
// Exit of the three release operations: recorded at every non-zero level.
void api_release_exit(uint32_t id);

// "Errors" and "Info" points: recorded when the category's level is non-zero.
void point_on(category c, uint32_t id, std::initializer_list<item> data);
inline void point(category c, uint32_t id, std::initializer_list<item> data) {
    if (level(c)) point_on(c, id, data);
}

// Elapsed-time record of the "Perf" category.  Armed when the Perf level
// equals `perf_level` at construction; record() adds the elapsed counter
// ticks, seconds and nanoseconds (64 bits each) after the given items.
class perf_timer {
public:
    explicit perf_timer(uint8_t perf_level);
    void record(uint32_t id, std::initializer_list<item> prefix);
    bool armed() const { return armed_; }
private:
    bool armed_ = false;
    uint64_t start_ = 0;
};

// Elapsed time between two (seconds, nanoseconds) readings; negative
// nanoseconds borrow one second.
void elapsed(uint64_t sec0, uint64_t nsec0, uint64_t sec1, uint64_t nsec1, int64_t *sec, int64_t *nsec);

}  // namespace acl::trace
