#include "output/MWOutputFile.h"

#include <fcntl.h>
#include <fmt/printf.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <system_error>
#include <utility>

#include "platform/MWTerminalText.h"

std::unique_ptr<MWOutputFile> MWOutputFile::_open(const std::string& path, int flags) {
    constexpr mode_t kEverybodyByUmask = 0666;
    const int descriptor = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | flags, kEverybodyByUmask);
    if (descriptor < 0) {
        return nullptr;
    }
    return std::unique_ptr<MWOutputFile>(new MWOutputFile(path, descriptor));
}

std::unique_ptr<MWOutputFile> MWOutputFile::create(const std::string& path) {
    return _open(path, O_TRUNC);
}

std::unique_ptr<MWOutputFile> MWOutputFile::createNew(const std::string& path) {
    return _open(path, O_EXCL);
}

MWOutputFile::~MWOutputFile() {
    if (_descriptor >= 0) {
        ::close(_descriptor);
    }
}

void MWOutputFile::write(std::string_view bytes) {
    while (!bytes.empty() && _error == 0) {
        const ssize_t count = ::write(_descriptor, bytes.data(), bytes.size());
        if (count >= 0) {
            bytes.remove_prefix(static_cast<size_t>(count));
        } else if (errno != EINTR) {
            _error = errno;
        }
    }
}

int MWOutputFile::finish() {
    const bool closed = ::close(std::exchange(_descriptor, -1)) == 0;
    if (!closed && _error == 0) {
        _error = errno;
    }
    return _error;
}

void MWOutputFile::close() {
    if (const int error = finish(); error != 0) {
        fmt::fprintf(stderr, "memweight: %s: %s\n", MWErrorText(_path),
                     std::generic_category().message(error));
    }
}
