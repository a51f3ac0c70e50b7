#include "platform/MWOutputPlace.h"

#include <fcntl.h>
#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/vfs.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <string_view>
#include <utility>

namespace {

/// A descriptor of a node, which is not opened by that.
class Node {
public:
    explicit Node(int descriptor) : _descriptor(descriptor) {}
    ~Node() {
        if (_descriptor >= 0) {
            close(_descriptor);
        }
    }
    Node(const Node&) = delete;
    Node& operator=(const Node&) = delete;

    int get() const { return _descriptor; }
    int release() { return std::exchange(_descriptor, -1); }
    void become(Node&& other) { std::swap(_descriptor, other._descriptor); }
    explicit operator bool() const { return _descriptor >= 0; }

private:
    int _descriptor;
};

Node look(int folder, const std::string& name, int flags) {
    return Node(openat(folder, name.c_str(), O_PATH | O_CLOEXEC | flags));
}

Node beginningOf(std::string_view path) {
    return look(AT_FDCWD, path.starts_with('/') ? "/" : ".", O_DIRECTORY);
}

bool isLink(const Node& node) {
    struct stat status = {};
    return fstat(node.get(), &status) == 0 && S_ISLNK(status.st_mode);
}

bool isInProc(const Node& node) {
    struct statfs system = {};
    return fstatfs(node.get(), &system) == 0 && system.f_type == PROC_SUPER_MAGIC;
}

/// One's own links lead where one wants, and so do those of the folder's owner, who could do worse.
bool mayFollow(const Node& folder, const Node& link) {
    struct stat of = {};
    struct stat what = {};
    if (fstat(folder.get(), &of) != 0 || fstat(link.get(), &what) != 0) {
        return false;
    }
    return (of.st_mode & S_IWOTH) == 0 || what.st_uid == geteuid() || what.st_uid == of.st_uid;
}

/// Empty with errno when it cannot be read.
std::string targetOf(const Node& link) {
    std::array<char, PATH_MAX> buffer = {};
    const ssize_t length = readlinkat(link.get(), "", buffer.data(), buffer.size());
    return {buffer.data(), static_cast<size_t>(std::max<ssize_t>(length, 0))};
}

/// The first name of a path, taken off it. The last one keeps the slash that says that it is a folder.
std::string takeName(std::string& path) {
    const size_t begin = std::min(path.find_first_not_of('/'), path.size());
    const size_t end = std::min(path.find('/', begin), path.size());
    std::string name = path.substr(begin, end - begin);
    const size_t next = std::min(path.find_first_not_of('/', end), path.size());
    path.erase(0, next == path.size() ? end : next);
    return name;
}

}  // namespace

std::optional<MWOutputPlace> MWOutputPlace::_find(const std::string& path, bool followsLast) {
    constexpr int kMostLinks = 40;
    int links = 0;
    std::string rest = path;
    Node folder = beginningOf(rest);
    for (std::string name = takeName(rest); folder; name = takeName(rest)) {
        if (name.empty()) {
            errno = path.empty() ? ENOENT : EISDIR;
            return std::nullopt;
        }
        Node node = look(folder.get(), name, O_NOFOLLOW);
        const bool isNew = !node && errno == ENOENT && rest.empty();
        const bool isFollowed = node && isLink(node) && (followsLast || !rest.empty());
        const bool isKernelLink = isFollowed && isInProc(node);
        if (isNew || (node && rest.empty() && (!isFollowed || isKernelLink))) {
            return MWOutputPlace(folder.release(), name, isKernelLink);
        }
        if (isKernelLink) {
            folder.become(look(folder.get(), name, O_DIRECTORY));
        } else if (!isFollowed) {
            folder.become(std::move(node));
        } else if (++links > kMostLinks || !mayFollow(folder, node)) {
            errno = links > kMostLinks ? ELOOP : EACCES;
            return std::nullopt;
        } else {
            std::string target = targetOf(node);
            if (target.empty()) {
                return std::nullopt;
            }
            if (target.starts_with('/')) {
                folder.become(beginningOf(target));
            }
            rest.insert(0, rest.empty() || rest.starts_with('/') ? target : target.append("/"));
        }
    }
    return std::nullopt;
}

bool MWOutputPlace::isSameAs(const MWOutputPlace& other) const {
    struct stat one = {};
    struct stat another = {};
    return _name == other._name && fstat(_folder, &one) == 0 && fstat(other._folder, &another) == 0 &&
           one.st_dev == another.st_dev && one.st_ino == another.st_ino;
}

void MWOutputPlace::unlinkRegularFile() const {
    struct stat status = {};
    if (fstatat(_folder, _name.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(status.st_mode)) {
        unlinkat(_folder, _name.c_str(), 0);
    }
}

MWOutputPlace::MWOutputPlace(MWOutputPlace&& other) noexcept
    : _folder(std::exchange(other._folder, -1)),
      _name(std::move(other._name)),
      _isKernelLink(other._isKernelLink) {}

MWOutputPlace::~MWOutputPlace() {
    if (_folder >= 0) {
        close(_folder);
    }
}

int MWOutputPlace::open(int flags, unsigned mode) const {
    const int follow = _isKernelLink ? 0 : O_NOFOLLOW;
    return openat(_folder, _name.c_str(), O_WRONLY | O_CLOEXEC | follow | flags, mode);
}
