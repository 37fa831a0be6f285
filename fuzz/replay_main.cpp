// Replays fuzz inputs without libFuzzer: every file named, and every file of
// every directory named, is passed once to LLVMFuzzerTestOneInput.  A
// failed check aborts, so CTest sees the replay fail.
#include <dirent.h>
#include <sys/stat.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstdio>
#include <fstream>
#include <iterator>
#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size);

namespace {

std::vector<std::string> inputs_of(const std::string &path) {
    struct stat st;
    if (stat(path.c_str(), &st) != 0) return {};
    if (!S_ISDIR(st.st_mode)) return {path};
    std::vector<std::string> files;
    if (DIR *d = opendir(path.c_str())) {
        while (dirent *e = readdir(d)) {
            std::string name = e->d_name;
            if (name == "." || name == "..") continue;
            std::string full = path + "/" + name;
            if (stat(full.c_str(), &st) == 0 && S_ISREG(st.st_mode)) files.push_back(full);
        }
        closedir(d);
    }
    std::sort(files.begin(), files.end());  // the same order on every run
    return files;
}

}  // namespace

int main(int argc, char **argv) {
    // The targets may point stdout and stderr elsewhere; report on copies.
    FILE *out = stdout, *err = stderr;
    size_t count = 0;
    for (int i = 1; i < argc; ++i) {
        std::vector<std::string> files = inputs_of(argv[i]);
        if (files.empty()) {
            std::fprintf(err, "%s: no inputs in %s\n", argv[0], argv[i]);
            return 1;
        }
        for (const std::string &f : files) {
            std::ifstream in(f, std::ios::binary);
            std::vector<char> bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
            LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t *>(bytes.data()), bytes.size());
            ++count;
        }
    }
    std::fprintf(out, "%s: replayed %zu inputs\n", argv[0], count);
    return count ? 0 : 1;
}
