#include "accuracy/SystemResources.h"

#include <fcntl.h>
#include <sys/swap.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <stdexcept>
#include <string>

namespace fs = std::filesystem;

std::shared_ptr<const fs::path> temporaryDirectory(const fs::path& parent) {
    std::string name = parent / "accuracy-XXXXXX";
    if (mkdtemp(name.data()) == nullptr) {
        throw std::runtime_error("cannot make a directory in " + parent.string());
    }
    fs::permissions(name, fs::perms(0755));
    return {new fs::path(name), [](const fs::path* path) {
                std::error_code ignored;
                fs::remove_all(*path, ignored);
                delete path;
            }};
}

// Written, not allocated: a swap file must have no holes, nor extents that were never written.
void writeCleanFile(const fs::path& path, uint64_t mebibytes) {
    const std::string block(1U << 20U, 'x');
    std::ofstream stream(path);
    for (uint64_t count = 0; count < mebibytes; ++count) {
        stream << block;
    }
    stream.close();
    const int file = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (!stream || fsync(file) != 0) {
        throw std::runtime_error("cannot write " + path.string());
    }
    close(file);
}

std::shared_ptr<const void> swapFile(uint64_t mebibytes) {
    const auto directory = temporaryDirectory("/var/tmp");
    const fs::path path = *directory / "swap";
    writeCleanFile(path, mebibytes);
    fs::permissions(path, fs::perms(0600));
    const std::string makeSwap = "PATH=$PATH:/usr/sbin:/sbin mkswap '" + path.string() + "' >/dev/null 2>&1";
    if (std::system(makeSwap.c_str()) != 0 || swapon(path.c_str(), 0) != 0) {
        return nullptr;
    }
    return {directory.get(), [directory, path](const void*) { swapoff(path.c_str()); }};
}

std::shared_ptr<const void> hugePages(uint64_t pages) {
    static constexpr const char* kPool = "/proc/sys/vm/nr_hugepages";
    uint64_t before = 0;
    uint64_t now = 0;
    std::ifstream(kPool) >> before;
    std::ofstream(kPool) << before + pages;
    std::ifstream(kPool) >> now;
    const std::shared_ptr<const void> held(kPool, [before](const void*) { std::ofstream(kPool) << before; });
    return now >= before + pages ? held : nullptr;
}
