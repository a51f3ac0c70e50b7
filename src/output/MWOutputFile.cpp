#include "output/MWOutputFile.h"

#include <fcntl.h>
#include <fmt/printf.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <optional>
#include <system_error>
#include <utility>

#include "platform/MWOutputPlace.h"
#include "platform/MWTerminalText.h"

std::unique_ptr<MWOutputFile> MWOutputFile::create(const std::string& path) {
    constexpr unsigned kEverybodyByUmask = 0666;
    const auto place = MWOutputPlace::find(path);
    const int descriptor = place ? place->open(O_CREAT | O_TRUNC, kEverybodyByUmask) : -1;
    return descriptor < 0 ? nullptr : std::make_unique<MWOutputFile>(path, descriptor);
}

MWOutputFile::~MWOutputFile() {
    if (_descriptor >= 0) {
        ::close(_descriptor);
    }
}

void MWOutputFile::write(std::string_view bytes) {
    const size_t whole = bytes.size();
    while (!bytes.empty() && _error == 0) {
        const ssize_t count = ::write(_descriptor, bytes.data(), bytes.size());
        if (count >= 0) {
            bytes.remove_prefix(static_cast<size_t>(count));
        } else if (errno != EINTR) {
            _error = errno;
        }
    }
    if (bytes.empty()) {
        _size += static_cast<off_t>(whole);
    } else if (_error != 0 && bytes.size() != whole) {
        // Nothing that can be cut, a pipe for example, keeps the part of a piece that it has got.
        [[maybe_unused]] const int ignored = ftruncate(_descriptor, _size);
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
