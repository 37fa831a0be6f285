// Deterministic ACL files for benchmarks: a number of user entries whose
// identifiers arrive sorted, reverse-sorted or shuffled, spread over one or
// more mechanisms, from a seed.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

namespace ryacl_bench {

enum class order { sorted, reverse, shuffled };

struct gen_options {
    size_t entries = 1000;
    order ord = order::shuffled;
    size_t mechanisms = 1;  // entry i uses mechanism i % mechanisms
    uint64_t seed = 1;
};

const char *order_name(order o);
bool parse_order(const std::string &s, order *o);

// The text of the file: a comment, an anyother entry, then `entries` user
// entries of about 40 bytes each.
std::string generate_acl(const gen_options &opt);
// Write it to `path`; false (errno set) on failure.
bool write_acl_file(const std::string &path, const gen_options &opt);

}  // namespace ryacl_bench
