#include "output/MWWholeFile.h"

#include <fcntl.h>
#include <fmt/format.h>
#include <fmt/ranges.h>
#include <sys/random.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <cstdio>
#include <utility>

namespace {

constexpr unsigned kForItsOwner = 0600;

}  // namespace

std::unique_ptr<MWWholeFile> MWWholeFile::create(MWOutputPlace place) {
    // Nobody can tell which name to take first.
    std::array<unsigned char, 8> random = {};
    static_cast<void>(getrandom(random.data(), random.size(), 0) < 0);
    const std::string temporary = fmt::format(".memweight-{:02x}", fmt::join(random, ""));
    std::unique_ptr<MWWholeFile> file(new MWWholeFile(std::move(place), temporary));
    const int folder = file->_place.folder();
    int descriptor = openat(folder, ".", O_TMPFILE | O_WRONLY | O_CLOEXEC, kForItsOwner);
    if (descriptor < 0 && (errno == EOPNOTSUPP || errno == EISDIR)) {
        descriptor = openat(folder, temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, kForItsOwner);
        file->_isNamed = descriptor >= 0;
    }
    if (descriptor < 0) {
        return nullptr;
    }
    file->_contents = std::make_unique<MWOutputFile>(temporary, descriptor);
    return file;
}

MWWholeFile::~MWWholeFile() {
    giveUp();
}

void MWWholeFile::giveUp() const {
    if (_isNamed) {
        unlinkat(_place.folder(), _temporary.c_str(), 0);
    }
}

int MWWholeFile::publish(bool replaced) {
    if (_contents->error() != 0) {
        return _contents->error();
    }
    // Most often there is nothing to replace, and no other name is needed.
    if (!_isNamed && _link(_place.name())) {
        const int error = _contents->finish();
        if (error != 0) {
            unlinkat(_place.folder(), _place.name().c_str(), 0);
        }
        return error;
    }
    if (!_isNamed && (!replaced || errno != EEXIST)) {
        return errno;
    }
    _isNamed = _isNamed || _link(_temporary);
    if (!_isNamed) {
        return errno;
    }
    const int error = _contents->finish();
    if (error != 0 || !_takeName(replaced)) {
        return error != 0 ? error : errno;
    }
    _isNamed = false;
    return 0;
}

/// Gives the file, which has no name, this one.
bool MWWholeFile::_link(const std::string& name) const {
    const std::string path = "/proc/self/fd/" + std::to_string(_contents->descriptor());
    return linkat(AT_FDCWD, path.c_str(), _place.folder(), name.c_str(), AT_SYMLINK_FOLLOW) == 0;
}

bool MWWholeFile::_takeName(bool replaced) const {
    const auto rename = [&](unsigned flags) {
        return renameat2(_place.folder(), _temporary.c_str(), _place.folder(), _place.name().c_str(),
                         flags) == 0;
    };
    // Not every file system can tell the two apart; that there was no such file has been seen before.
    return rename(replaced ? 0 : RENAME_NOREPLACE) || (!replaced && errno == EINVAL && rename(0));
}
