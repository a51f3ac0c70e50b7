#include "platform/linux/Procfs.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

#include "platform/MWProgress.h"
#include "platform/linux/ProcText.h"

namespace procfs {

Descriptor& Descriptor::operator=(Descriptor&& other) noexcept {
    if (this != &other) {
        reset();
        _descriptor = other.release();
    }
    return *this;
}

int Descriptor::release() {
    return std::exchange(_descriptor, -1);
}

void Descriptor::reset() {
    if (_descriptor >= 0) {
        ::close(release());
    }
}

Descriptor open(int directory, const char* path, int flags) {
    return Descriptor(::openat(directory, path, O_RDONLY | O_CLOEXEC | flags));
}

ptrdiff_t readSome(int descriptor, std::span<char> buffer) {
    ptrdiff_t count = 0;
    do {
        count = ::read(descriptor, buffer.data(), buffer.size());
    } while (count < 0 && errno == EINTR);
    MWProgress::mark();
    return count;
}

bool readFile(int directory, const char* path, std::string& text, size_t limit) {
    constexpr size_t kStep = 4096;
    text.clear();
    const Descriptor file = open(directory, path);
    if (!file) {
        return false;
    }
    while (text.size() < limit) {
        const size_t length = text.size();
        text.resize(std::min(limit, length + kStep));
        const ptrdiff_t count = readSome(file.get(), std::span(text).subspan(length));
        text.resize(length + static_cast<size_t>(std::max<ptrdiff_t>(count, 0)));
        if (count <= 0) {
            return count == 0;
        }
    }
    return true;
}

bool readRecord(int directory, const char* path, std::string& text) {
    constexpr size_t kRoom = 4096;
    text.clear();
    const Descriptor file = open(directory, path);
    if (!file) {
        return false;
    }
    ptrdiff_t count = 0;
    size_t length = 0;
    do {
        text.resize(length + kRoom);
        count = readSome(file.get(), std::span(text).subspan(length));
        length += static_cast<size_t>(std::max<ptrdiff_t>(count, 0));
    } while (count == static_cast<ptrdiff_t>(kRoom));
    text.resize(length);
    return count >= 0;
}

bool readLink(int directory, const char* path, std::string& target) {
    std::array<char, 4096> buffer = {};
    const ptrdiff_t length = ::readlinkat(directory, path, buffer.data(), buffer.size());
    if (length < 0) {
        return false;
    }
    target.assign(buffer.data(), static_cast<size_t>(length));
    return true;
}

bool forEachEntry(int parent, const char* path, const std::function<bool(int, const char*)>& visit) {
    Descriptor list = open(parent, path, O_DIRECTORY);
    DIR* entries = list ? fdopendir(list.get()) : nullptr;
    if (entries == nullptr) {
        return false;
    }
    list.release();  // closed with the stream
    bool goOn = true;
    while (const dirent* entry = goOn ? readdir(entries) : nullptr) {
        const std::string_view name = entry->d_name;
        goOn = name == "." || name == ".." || visit(dirfd(entries), entry->d_name);
    }
    closedir(entries);
    return true;
}

uint64_t readNamespace(int processDirectory, const std::string& kind) {
    std::string target;
    return readLink(processDirectory, ("ns/" + kind).c_str(), target) ? parseNamespace(target) : 0;
}

}  // namespace procfs
