#pragma once

#include <memory>
#include <string>
#include <string_view>

/// A file that a report is written to, piece by piece. A report on a full disk does not end the run: the
/// first error is kept and told when the file is closed, and nothing is written after it.
class MWOutputFile {
public:
    /// Creates or empties the file; none with errno when that fails.
    static std::unique_ptr<MWOutputFile> create(const std::string& path);
    /// None with errno EEXIST where there is something of this name already.
    static std::unique_ptr<MWOutputFile> createNew(const std::string& path);
    /// Closes without a word.
    ~MWOutputFile();
    MWOutputFile(const MWOutputFile&) = delete;
    MWOutputFile& operator=(const MWOutputFile&) = delete;

    /// Not buffered: pieces should be large, and whole where the file has to be readable at any moment.
    void write(std::string_view bytes);
    /// Closes; errno of the first failure, 0 when all was written.
    int finish();
    /// Closes and tells the first error on standard error: "memweight: PATH: No space left on device".
    void close();

private:
    static std::unique_ptr<MWOutputFile> _open(const std::string& path, int flags);
    MWOutputFile(std::string path, int descriptor) : _path(std::move(path)), _descriptor(descriptor) {}

    std::string _path;
    int _descriptor;  ///< -1 once closed
    int _error = 0;   ///< errno of the first failure
};
