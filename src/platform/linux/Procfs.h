#pragma once

#include <cstddef>
#include <functional>
#include <span>
#include <string>
#include <string_view>

/// Reading of procfs, relative to a directory descriptor, so that a directory opened once keeps naming the
/// same process (a read after its end fails with ESRCH) and tests can hand in a small tree of recorded files.
namespace procfs {

/// A descriptor that is closed with its owner; -1 when there is none.
class Descriptor {
public:
    Descriptor() = default;
    explicit Descriptor(int descriptor) : _descriptor(descriptor) {}
    ~Descriptor() { reset(); }
    Descriptor(Descriptor&& other) noexcept : _descriptor(other.release()) {}
    Descriptor& operator=(Descriptor&& other) noexcept;

    int get() const { return _descriptor; }
    explicit operator bool() const { return _descriptor >= 0; }
    int release();
    void reset();

private:
    int _descriptor = -1;
};

/// Opens for reading, O_CLOEXEC; -1 with errno on failure.
Descriptor open(int directory, const char* path, int flags = 0);

/// The next bytes into `buffer`, as many as one read gives; 0 at the end, -1 with errno on failure.
ptrdiff_t readSome(int descriptor, std::span<char> buffer);

/// The whole of a small file into `text` (whose capacity is reused), at most `limit` bytes. False with
/// errno on failure, `text` then holds what was read.
bool readFile(int directory, const char* path, std::string& text, size_t limit = 1U << 20U);

/// The same for a file that the kernel hands out in one piece, such as `stat`: its end need not be looked
/// for.
bool readRecord(int directory, const char* path, std::string& text);

/// The target of a symbolic link; false with errno on failure.
bool readLink(int directory, const char* path, std::string& target);

/// Visits the entries of a directory, "." and ".." left out, with a descriptor of the directory and the
/// entry's name, until a visit answers false. False with errno when the directory cannot be opened.
bool forEachEntry(int parent, const char* path, const std::function<bool(int, const char*)>& visit);

/// The namespace of this kind ("ipc", "mnt", "net") of the process with this directory; 0 when it cannot be
/// read.
uint64_t readNamespace(int processDirectory, const std::string& kind);

}  // namespace procfs
