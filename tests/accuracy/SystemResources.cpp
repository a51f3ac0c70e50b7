#include "accuracy/SystemResources.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/swap.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <fstream>
#include <stdexcept>
#include <vector>

namespace {

constexpr const char* kHugePagePool = "/proc/sys/vm/nr_hugepages";

uint64_t hugePagesInPool() {
    uint64_t pages = 0;
    std::ifstream(kHugePagePool) >> pages;
    return pages;
}

void setHugePagesInPool(uint64_t pages) {
    std::ofstream(kHugePagePool) << pages;
}

// Written, not allocated: a swap file must have no holes, nor extents that were never written.
int writeFile(const std::string& path, uint64_t bytes, mode_t mode) {
    const int file = open(path.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, mode);
    std::vector<char> block(1U << 20U, 'x');
    for (uint64_t left = bytes; file >= 0 && left != 0;) {
        const ssize_t count = write(file, block.data(), std::min<uint64_t>(left, block.size()));
        if (count <= 0) {
            break;
        }
        left -= static_cast<uint64_t>(count);
    }
    struct stat status = {};
    if (fstat(file, &status) != 0 || static_cast<uint64_t>(status.st_size) != bytes || fsync(file) != 0) {
        throw std::runtime_error("cannot write " + path);
    }
    return file;
}

bool useForSwap(const std::string& path, uint64_t bytes) {
    close(writeFile(path, bytes, S_IRUSR | S_IWUSR));
    const std::string makeSwap = "PATH=$PATH:/usr/sbin:/sbin mkswap '" + path + "' >/dev/null 2>&1";
    return std::system(makeSwap.c_str()) == 0 && swapon(path.c_str(), 0) == 0;
}

}  // namespace

TemporaryDirectory::TemporaryDirectory(const std::filesystem::path& parent) {
    std::string name = parent / "accuracy-XXXXXX";
    if (mkdtemp(name.data()) == nullptr) {
        throw std::runtime_error("cannot make a directory in " + parent.string());
    }
    _path = name;
    chmod(name.c_str(), S_IRWXU | S_IRGRP | S_IXGRP | S_IROTH | S_IXOTH);
}

TemporaryDirectory::~TemporaryDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(_path, ignored);
}

SwapFile::SwapFile(uint64_t bytes)
    : _directory("/var/tmp"), _path(_directory / "swap"), _isUsed(useForSwap(_path, bytes)) {}

SwapFile::~SwapFile() {
    swapoff(_path.c_str());
}

HugePages::HugePages(uint64_t pages) : _before(hugePagesInPool()) {
    setHugePagesInPool(_before + pages);
    _areThere = hugePagesInPool() >= _before + pages;
}

HugePages::~HugePages() {
    setHugePagesInPool(_before);
}

void writeCleanFile(const std::filesystem::path& path, uint64_t bytes) {
    close(writeFile(path, bytes, S_IRUSR | S_IWUSR | S_IRGRP | S_IROTH));
}
