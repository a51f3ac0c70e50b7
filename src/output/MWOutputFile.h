#pragma once

#include <sys/types.h>

#include <memory>
#include <string>
#include <string_view>
#include <utility>

/// A file that a report is written to, piece by piece. A report on a full disk does not end the run: the
/// first error is kept and told when the file is closed, and nothing is written after it.
class MWOutputFile {
public:
    /// Creates or empties the file, for which no planted link is followed (see MWOutputPlace); none with
    /// errno when that fails.
    static std::unique_ptr<MWOutputFile> create(const std::string& path);
    /// Takes over a descriptor of an empty file; `path` is what the file is called in messages.
    MWOutputFile(std::string path, int descriptor) : _path(std::move(path)), _descriptor(descriptor) {}
    /// Closes without a word.
    ~MWOutputFile();
    MWOutputFile(const MWOutputFile&) = delete;
    MWOutputFile& operator=(const MWOutputFile&) = delete;

    /// Not buffered: pieces should be large, and whole where the file has to be readable at any moment. Of a
    /// piece that cannot be written whole a regular file has nothing.
    void write(std::string_view bytes);
    /// errno of the first failure so far, 0 for none.
    int error() const { return _error; }
    int descriptor() const { return _descriptor; }
    /// Closes; errno of the first failure, 0 when all was written.
    int finish();
    /// Closes and tells the first error on standard error: "memweight: PATH: No space left on device".
    void close();

private:
    std::string _path;
    int _descriptor;  ///< -1 once closed
    int _error = 0;   ///< errno of the first failure
    off_t _size = 0;  ///< of the pieces written
};
