// ryacl: loading a text or compiled ACL file into entries (see acl_load.h).
#include "acl_load.h"

#include "acl_match.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <map>
#include <new>

#include "ry_zo_int.h"
#include "ryacl_acl_buffer.h"
#include "ryacl_acl_check.h"
#include "ryacl_acl_entry.h"
#include "ryacl_acl_file.h"
#include "ryacl_acl_tree.h"
#include "ryacl_alloc.h"
#include "ryacl_error.h"
#include "ryacl_cmd.h"

namespace ryacl {

loaded_acl::~loaded_acl() { std::free(bytes); }

void print_error() { acl::report_current_error(stderr, true); }

int out_of_memory_guard(const char *subcommand, const std::function<int()> &run) {
    try {
        return run();
    } catch (const std::bad_alloc &) {
        std::fprintf(stderr, "ryacl %s: out of memory\n", subcommand);
        return RYACL_EXIT_TROUBLE;
    }
}

int32_t loaded_acl::add_text(char *text, size_t size) {
    // Room for an entry per 24 bytes, more than real files hold, so that a
    // large file is not copied as it grows (pages never reached cost
    // nothing); a file of shorter lines grows past it as usual.
    items.reserve(items.size() + size / 24 + 16);
    char *cursor = text;
    size_t left = size + 1;  // the terminating NUL counts
    int32_t lineno = 1;
    acl__line_ctx ctx;
    ctx.classes = acl__line_classes();
    for (;;) {
        const int32_t line = lineno;
        sec_acle_desc acle{};
        acl__line_fault fault;
        int32_t rc = acl__read_acle_deferred(&acl__default_perm_set, &cursor, &left, &lineno, &acle, &fault, &ctx);
        if (rc == 0) return 0;
        if (rc != 1) return acl__record_line_fault(fault);
        if (acle.type == 0) continue;
        acl_item e{};
        e.type = acle.type;
        e.perm = acle.perm;
        e.line = line;
        std::memcpy(e.mech, acle.mech, sizeof e.mech);
        e.mech[16] = '\0';
        e.id = acle.id;
        e.idlen = acle.id ? static_cast<uint32_t>(ctx.idlen) : 0;
        items.push_back(e);
    }
}

// The walk of a buffer that sec__check_acl_buffer has accepted: every count
// and length inside it is consistent and within its bytes.
int32_t loaded_acl::add_compiled(const unsigned char *p, size_t n) {
    compiled = true;
    const unsigned nsub = acl__load_le16(p + 3);
    size_t pos = ACL_HDR_SIZE;
    for (unsigned k = 0; k < nsub && pos + ACL_SUBACL_HDR_SIZE <= n; ++k) {
        const size_t sublen = acl__load_le32(p + pos);
        const unsigned char type = p[pos + 4];
        const uint32_t count = acl__load_le32(p + pos + 5);
        const size_t mlen = p[pos + 9];
        // Validated: a mechanism ends on its zero byte within 17 bytes.
        const char *mech = mlen ? reinterpret_cast<const char *>(p + pos + 10) : "";
        acl_sub &sub = compiled_subs_.emplace_back(acl_sub{type, mech, {}});
        size_t at = pos + ACL_SUBACL_HDR_SIZE + mlen;
        for (uint32_t j = 0; j < count && at + ACL_ENTRY_HDR_SIZE <= n; ++j) {
            const size_t idlen = acl__load_le16(p + at + 5);
            acl_item e{};
            e.type = type;
            e.perm = acl__load_le32(p + at + 1);
            std::memcpy(e.mech, mech, std::strlen(mech) + 1);
            if (idlen) {
                e.id = reinterpret_cast<const char *>(p + at + ACL_ENTRY_HDR_SIZE);
                e.idlen = static_cast<uint32_t>(idlen - 1);
            }
            sub.items.push_back(static_cast<uint32_t>(items.size()));
            items.push_back(e);
            at += ACL_ENTRY_HDR_SIZE + idlen;
        }
        pos += sublen;
    }
    return 0;
}

std::vector<acl_sub> loaded_acl::subs() const {
    if (compiled) return compiled_subs_;
    // A text's entries of one sub-ACL may be spread over the file.
    std::vector<acl_sub> out;
    std::map<std::pair<unsigned char, std::string>, size_t> at;
    for (uint32_t i = 0; i < items.size(); ++i) {
        const acl_item &e = items[i];
        auto [it, fresh] = at.try_emplace({e.type, e.mech}, out.size());
        if (fresh) out.push_back(acl_sub{e.type, e.mech, {}});
        out[it->second].items.push_back(i);
    }
    // The library lays user and group entries down in ascending
    // case-insensitive order, expanded entries as they came.
    for (acl_sub &s : out) {
        if (s.type != SEC_ACLE_TYPE_USER && s.type != SEC_ACLE_TYPE_GROUP) continue;
        std::stable_sort(s.items.begin(), s.items.end(), [this](uint32_t a, uint32_t b) {
            return zo::casecmp_len(items[a].id, items[a].idlen, items[b].id, items[b].idlen) < 0;
        });
    }
    return out;
}

namespace {

// Read and parse or walk; a failure is recorded, and the entries read
// before it stay.
int32_t read_acl_file(const char *path, bool text_only, loaded_acl &out) {
    out.path = path;
    int fd = open(path, O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK);
    if (fd < 0) return acl::set_error(ACL_RC_FILE_ERROR, acl::msg::FILE_OPEN, path, errno);
    int32_t rc = acl__read_acl_file(path, fd, &out.bytes, &out.nbytes);
    close(fd);
    if (rc || !out.bytes) return rc;  // an empty file: no entries
    return add_file_bytes(text_only, out);
}

}  // namespace

int32_t add_file_bytes(bool text_only, loaded_acl &out) {
    int32_t rc;
    const auto *p = reinterpret_cast<const unsigned char *>(out.bytes);
    if (text_only || out.nbytes < 2 || p[0] != ACL_BUF_TYPE || p[1] != ACL_BUF_VERSION)
        return out.add_text(out.bytes, out.nbytes);
    // Only a compiled ACL in this host's byte order is compared: one in the
    // other order was not written here and is refused, not guessed at.
    if (out.nbytes > INT32_MAX) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_TOO_SHORT, 0, ACL_LOC_ACL);
    if (out.nbytes < ACL_HDR_SIZE)
        return acl::set_error(ACL_RC_BAD_ACL, acl::msg::ACL_TOO_SHORT, static_cast<int32_t>(out.nbytes), ACL_LOC_ACL);
    if (p[2] != ACL_BUF_HOST_ORDER) return acl::set_error(ACL_RC_BAD_ACL, acl::msg::BAD_BYTE_ORDER);
    sec_buffer_desc d{static_cast<int32_t>(out.nbytes), out.bytes};
    if ((rc = sec__check_acl_buffer(&d)) != 0) return rc;
    return out.add_compiled(p, out.nbytes);
}

bool load_acl_file(const char *path, bool text_only, loaded_acl &out, bool screen) {
    int32_t rc = read_acl_file(path, text_only, out);
    if (rc || screen) {
        const loaded_acl none;
        entry_matcher alone(out, none);
        if (int32_t dup = alone.run()) rc = dup;
    }
    if (rc) print_error();
    return rc == 0;
}

bool load_acl_buffer(const sec_buffer_desc &buf, const std::string &path, loaded_acl &out) {
    out.path = path;
    const size_t n = static_cast<size_t>(buf.length);
    out.bytes = static_cast<char *>(std::malloc(n ? n : 1));
    if (!out.bytes) {
        acl__no_memory("ryacl", n);
        print_error();
        return false;
    }
    std::memcpy(out.bytes, buf.value, n);
    out.nbytes = n;
    return out.add_compiled(reinterpret_cast<const unsigned char *>(out.bytes), n) == 0;
}

std::string perm_letters(uint32_t perm) {
    char letters[33] = {0};
    if (sec__translate_bitmask(perm, &acl__default_perm_set, letters) == 0) return letters;
    acl::clear_error();
    char hex[16];
    std::snprintf(hex, sizeof hex, "0x%08x", perm);
    return hex;
}

std::string entry_text(const acl_item &e, bool with_perm) {
    std::string s(1, acl__type_letter(e.type));
    if (e.mech[0]) s.append(" ").append(e.mech);
    if (e.id) s.append(" ").append(e.id, e.idlen);
    if (with_perm && e.perm) s += ' ' + perm_letters(e.perm);
    return s;
}

const char *type_word(unsigned char type) {
    switch (type) {
    case SEC_ACLE_TYPE_UNAUTHENTICATED: return "unauthenticated";
    case SEC_ACLE_TYPE_ANYOTHER: return "anyother";
    case SEC_ACLE_TYPE_USER: return "user";
    case SEC_ACLE_TYPE_EXPANDED: return "expanded";
    case SEC_ACLE_TYPE_GROUP: return "group";
    default: return "?";
    }
}

}  // namespace ryacl
