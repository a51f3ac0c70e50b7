#pragma once

#include <optional>
#include <string>

/// Where an output file is to be: its folder, held open, and its name in there.
///
/// Symbolic links are followed, but for those that somebody else has put into a folder that everybody may
/// write to: through them a measurement by root would overwrite what others choose.
class MWOutputPlace {
public:
    /// None with errno; EACCES for a link that is not followed.
    static std::optional<MWOutputPlace> find(const std::string& path) { return _find(path, true); }
    /// The same, but for a link that the path itself is: that one is the place then.
    static std::optional<MWOutputPlace> findWithoutLast(const std::string& path) {
        return _find(path, false);
    }
    ~MWOutputPlace();
    MWOutputPlace(MWOutputPlace&& other) noexcept;
    MWOutputPlace& operator=(MWOutputPlace&&) = delete;
    MWOutputPlace(const MWOutputPlace&) = delete;
    MWOutputPlace& operator=(const MWOutputPlace&) = delete;

    int folder() const { return _folder; }
    /// Never that of a link that still is to be followed, unless the kernel alone can follow it.
    const std::string& name() const { return _name; }
    /// Whether the two are one name of one folder.
    bool isSameAs(const MWOutputPlace& other) const;
    /// Removes what is there if it is a regular file.
    void unlinkRegularFile() const;
    /// Opens for writing, with these flags beside; negative with errno.
    int open(int flags, unsigned mode) const;

private:
    static std::optional<MWOutputPlace> _find(const std::string& path, bool followsLast);
    MWOutputPlace(int folder, std::string name, bool isKernelLink)
        : _folder(folder), _name(std::move(name)), _isKernelLink(isKernelLink) {}

    int _folder;
    std::string _name;
    bool _isKernelLink;  ///< an open file under /proc, say of /dev/stdout
};
