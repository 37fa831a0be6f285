// Deterministic ACL file generator, and with RYACL_GEN_MAIN the command
//   ryacl_gen [-n entries] [-o sorted|reverse|shuffled] [-m mechanisms] [-s seed] FILE
#include "acl_gen.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <vector>

namespace ryacl_bench {

namespace {

// splitmix64: the same sequence on every platform and library, unlike the
// standard distributions.
uint64_t next(uint64_t &s) {
    uint64_t z = (s += 0x9e3779b97f4a7c15ull);
    z = (z ^ (z >> 30)) * 0xbf58476d1ce4e5b9ull;
    z = (z ^ (z >> 27)) * 0x94d049bb133111ebull;
    return z ^ (z >> 31);
}

}  // namespace

const char *order_name(order o) {
    switch (o) {
    case order::sorted: return "sorted";
    case order::reverse: return "reverse";
    default: return "shuffled";
    }
}

bool parse_order(const std::string &s, order *o) {
    if (s == "sorted") *o = order::sorted;
    else if (s == "reverse") *o = order::reverse;
    else if (s == "shuffled") *o = order::shuffled;
    else return false;
    return true;
}

std::string generate_acl(const gen_options &opt) {
    std::vector<uint32_t> idx(opt.entries);
    for (size_t i = 0; i < opt.entries; ++i) idx[i] = static_cast<uint32_t>(i);
    uint64_t state = opt.seed;
    if (opt.ord == order::reverse) {
        for (size_t i = 0; i < opt.entries / 2; ++i) std::swap(idx[i], idx[opt.entries - 1 - i]);
    } else if (opt.ord == order::shuffled) {
        for (size_t i = opt.entries; i > 1; --i) std::swap(idx[i - 1], idx[next(state) % i]);
    }
    const size_t mechs = opt.mechanisms ? opt.mechanisms : 1;
    std::string out;
    out.reserve(64 + opt.entries * 46);
    out += "# generated: benchmark ACL\no r\n";
    static const char *const perms[] = {"r", "rw", "rwx"};
    char line[128];
    for (size_t k = 0; k < opt.entries; ++k) {
        const uint32_t i = idx[k];
        char mech[17];
        if (mechs == 1) std::snprintf(mech, sizeof mech, "unix");
        else std::snprintf(mech, sizeof mech, "m%06zu", static_cast<size_t>(i % mechs));
        int n = std::snprintf(line, sizeof line, "u %s user%07u@node%02u.example.com %s\n", mech, i, i % 100,
                              perms[i % 3]);
        out.append(line, static_cast<size_t>(n));
    }
    return out;
}

bool write_acl_file(const std::string &path, const gen_options &opt) {
    const std::string text = generate_acl(opt);
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
    if (fd < 0) return false;
    size_t off = 0;
    while (off < text.size()) {
        ssize_t w = write(fd, text.data() + off, text.size() - off);
        if (w < 0) {
            if (errno == EINTR) continue;
            int e = errno;
            close(fd);
            errno = e;
            return false;
        }
        off += static_cast<size_t>(w);
    }
    return close(fd) == 0;
}

}  // namespace ryacl_bench

#ifdef RYACL_GEN_MAIN
#include <cstdlib>

int main(int argc, char **argv) {
    ryacl_bench::gen_options opt;
    int c;
    while ((c = getopt(argc, argv, "n:o:m:s:")) != -1) {
        switch (c) {
        case 'n': opt.entries = std::strtoull(optarg, nullptr, 10); break;
        case 'o':
            if (!ryacl_bench::parse_order(optarg, &opt.ord)) {
                std::fprintf(stderr, "ryacl_gen: unknown order %s\n", optarg);
                return 2;
            }
            break;
        case 'm': opt.mechanisms = std::strtoull(optarg, nullptr, 10); break;
        case 's': opt.seed = std::strtoull(optarg, nullptr, 10); break;
        default: goto usage;
        }
    }
    if (optind + 1 != argc) goto usage;
    if (!ryacl_bench::write_acl_file(argv[optind], opt)) {
        std::fprintf(stderr, "ryacl_gen: %s: %s\n", argv[optind], std::strerror(errno));
        return 1;
    }
    return 0;
usage:
    std::fprintf(stderr, "usage: ryacl_gen [-n entries] [-o sorted|reverse|shuffled] [-m mechanisms] [-s seed] FILE\n");
    return 2;
}
#endif
