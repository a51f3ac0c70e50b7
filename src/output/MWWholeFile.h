#pragma once

#include <memory>
#include <string>

#include "output/MWOutputFile.h"
#include "platform/MWOutputPlace.h"

/// A file for its owner alone that gets its name only when it is whole. Until then it has none, or where the
/// file system knows no such files a temporary one; either is gone with this object.
class MWWholeFile {
public:
    /// None with errno.
    static std::unique_ptr<MWWholeFile> create(MWOutputPlace place);
    ~MWWholeFile();
    MWWholeFile(const MWWholeFile&) = delete;
    MWWholeFile& operator=(const MWWholeFile&) = delete;

    MWOutputFile& contents() { return *_contents; }
    /// Removes the temporary name, if there is one: the program will end without destroying anything.
    void giveUp() const;
    /// Closes the file and gives it its name, in the place of a file that has it where that is `replaced`.
    /// The first error of it all, from the first write on, as errno; 0 when all is well.
    int publish(bool replaced);

private:
    MWWholeFile(MWOutputPlace place, std::string temporary)
        : _place(std::move(place)), _temporary(std::move(temporary)) {}

    bool _link(const std::string& name) const;
    bool _takeName(bool replaced) const;

    MWOutputPlace _place;
    std::string _temporary;  ///< name in the same folder
    bool _isNamed = false;   ///< `_temporary` exists
    std::unique_ptr<MWOutputFile> _contents;
};
