// ryacl: an ACL file loaded as a list of entries, for the subcommands that
// compare or explain ACLs rather than check them.  A text file is parsed
// with the library's parser and screened for duplicates as a check would;
// a compiled ACL (a cache file) is validated as the library validates one.
// Entries keep their text line numbers.  Duplicates are the business of
// acl_match.h, which diff needs anyway.
#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "ryacl.h"

namespace ryacl {

struct acl_item {
    const char *id;     // NUL-terminated; null for types 1 and 2
    uint32_t idlen;     // strlen(id), 0 when none
    uint32_t perm;
    char mech[17];      // "" for types without; lower-case from a text
    int32_t line;       // line of a text file; 0 in a compiled ACL
    unsigned char type;
};

// One sub-ACL: the entries of one type and mechanism, in the order that the
// library's evaluation walks them.
struct acl_sub {
    unsigned char type;
    const char *mech;  // that of its first entry
    std::vector<uint32_t> items;
};

class loaded_acl {
public:
    loaded_acl() = default;
    ~loaded_acl();
    loaded_acl(const loaded_acl &) = delete;
    loaded_acl &operator=(const loaded_acl &) = delete;

    std::string path;
    bool compiled = false;
    std::vector<acl_item> items;       // text: file order; compiled: buffer order
    // Sub-ACLs in evaluation order: those of a compiled ACL in buffer order,
    // those of a text in the order the library compiles them.
    std::vector<acl_sub> subs() const;

    // Filling (acl_load.cpp).
    int32_t add_text(char *text, size_t size);
    int32_t add_compiled(const unsigned char *p, size_t n);
    char *bytes = nullptr;  // owned: the file read (text parsed in place)
    size_t nbytes = 0;

private:
    std::vector<acl_sub> compiled_subs_;  // as the buffer lays them down
};

// Read the file at `path` as it is: a compiled ACL when it begins with the
// compiled ACL's type and version bytes, text otherwise (`text_only`: always
// text), and screen it for duplicates (without `screen`, only when it is
// faulty otherwise: a duplicate before the faulty line is its first fault).
// On failure the numbered message is on standard error and the result is
// false.
bool load_acl_file(const char *path, bool text_only, loaded_acl &out, bool screen = true);
// The entries of the file's bytes in out.bytes (out.nbytes of them and a
// zero byte after), read as load_acl_file reads them but not screened: 0,
// or the return code of the first fault, recorded.
int32_t add_file_bytes(bool text_only, loaded_acl &out);
// Load a compiled ACL in host byte order that the library has validated.
bool load_acl_buffer(const sec_buffer_desc &buf, const std::string &path, loaded_acl &out);

// An entry in ACL file syntax ("u unix alice rw"), without its letters
// when `with_perm` is false; bytes from the file are passed as they stand.
std::string entry_text(const acl_item &e, bool with_perm = true);
// Permission letters of a mask ("" for none); a bit without a template
// shows the mask in hexadecimal instead.
std::string perm_letters(uint32_t perm);
// Word for a type in messages ("user", "group", ...).
const char *type_word(unsigned char type);

// Print the thread's current error (the report sequence) on stderr.
void print_error();

// Run a subcommand; memory that cannot be had ends it with a message and
// the trouble status instead of an abort, its objects released on the way.
int out_of_memory_guard(const char *subcommand, const std::function<int()> &run);

}  // namespace ryacl
