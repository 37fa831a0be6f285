// The library's trace component "_SEL": five categories, detail levels kept
// current by the trace facility, and the helpers every trace point uses.
// A point that is off costs one once-check and one byte read.
#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>

#include "ry_zo_int.h"

extern "C" {
extern tr_detail_level_t acl__trace_detail_levels[5];
int32_t acl__trace_register_component(void);
}

namespace acl::trace {

enum category : unsigned { ERRORS = 0, INFO = 1, API = 2, BUFFER = 3, PERF = 4 };

// Run the registration once per process (pthread_once).
void ensure_registered();

inline tr_detail_level_t level(category c) {
    ensure_registered();
    return acl__trace_detail_levels[c];
}

// One data item: an address and a length in bytes.
struct item {
    const void *p;
    size_t n;
};
// A text with its NUL; a null text is recorded as `absent` ("" by default).
item str(const char *s, const char *absent = "");
template <class T>
inline item val(const T &v) { return item{&v, sizeof v}; }

void record_id(uint32_t id);
void record_data(uint32_t id, std::initializer_list<item> items);

// "API" category points.  Entry: level 1 records `id`, level 8 records
// `data_id` with the data.  Exit: level 1 records `id`, level 8 records
// `rc_id` with the return code, or, on success when results are given,
// `result_id` with the return code and the results.
void api_entry(uint32_t id, uint32_t data_id, std::initializer_list<item> data);
void api_exit(uint32_t id, uint32_t rc_id, int32_t rc);
void api_exit(uint32_t id, uint32_t rc_id, uint32_t result_id, int32_t rc,
              std::initializer_list<item> results);
// Exit of the three release operations: recorded at every non-zero level.
void api_release_exit(uint32_t id);

// "Errors" and "Info" points: recorded when the category's level is non-zero.
void point(category c, uint32_t id, std::initializer_list<item> data);

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

}  // namespace acl::trace
