// Shared helpers of the test suite: temporary directories, files, running
// the checker as a real process, reading the error slot, failing
// allocations on purpose.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace rytest {

// A fresh directory under $TMPDIR (or /tmp), removed with its contents.
class tmp_dir {
public:
    tmp_dir();
    ~tmp_dir();
    tmp_dir(const tmp_dir &) = delete;
    tmp_dir &operator=(const tmp_dir &) = delete;
    const std::string &path() const { return path_; }
    std::string operator/(const std::string &name) const { return path_ + "/" + name; }
private:
    std::string path_;
};

void write_file(const std::string &path, const std::string &content, mode_t mode = 0644);
std::string read_file(const std::string &path);
bool file_exists(const std::string &path);
// Names in a directory, sorted, without "." and "..".
std::vector<std::string> list_dir(const std::string &path);

struct run_result {
    int status = -1;  // exit status, or 128 + signal
    std::string out;  // standard output
    std::string err;  // standard error
};
// Run a program with arguments (argv[0] is the path), in directory `cwd`
// when not empty, with extra environment entries "NAME=value".
run_result run(const std::vector<std::string> &argv, const std::string &cwd = "",
               const std::vector<std::string> &env = {});
// Run the built ryaclfck.
run_result run_ryaclfck(const std::vector<std::string> &args, const std::string &cwd = "",
                        const std::vector<std::string> &env = {});

// The current error of this thread: its return code (0 when none), message
// number (0 when none) and formatted text ("" when none).  Leaves it in place.
int32_t error_code();
int32_t error_msgnum();
std::string error_text();
// The default text of a message, formatted with the given text arguments is
// not offered: tests compare against literal expected texts.

// Allocation failure injection through the library's allocation hook.
// fail_nth(n): the n-th allocation from now (1-based) fails, the others
// succeed.  Returns the number of allocations counted since the last call.
void alloc_fail_nth(long n);
void alloc_fail_none();
long alloc_count();

// Run `flow` with the 1st, 2nd, ... allocation failing in turn until a run
// completes without reaching the failing allocation; `check` is called after
// each failing run with the flow's result.  Returns the number of
// allocation sites reached.
long for_each_alloc_failure(const std::function<int32_t()> &flow,
                            const std::function<void(int32_t rc, long nth)> &check,
                            const std::function<void()> &reset = {});

}  // namespace rytest
