#include "cli/MWHeapsnapEntry.h"

#include <fcntl.h>
#include <fmt/printf.h>
#include <getopt.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <optional>
#include <string>
#include <string_view>
#include <system_error>

#include "cli/MWVersion.h"
#include "output/MWHeapsnapWriter.h"
#include "output/MWOutputFile.h"
#include "platform/MWHostInterface.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "platform/MWTerminalText.h"
#include "process/MWRecordedProcess.h"

namespace {

constexpr int kSuccess = 0;
constexpr int kFailure = 1;

constexpr const char* kUsage =
    "Save the memory of a process to a file, which memweight then reads like the process\n"
    "Usage: memweight-heapsnap [args] pid\n"
    "    -o, --output <file>                   the file (default: NAME-PID.heapsnap in this folder)\n"
    "    -f, --force                           replace the file if it is there\n"
    "    --vmObjectDirty                       interpret dirty memory as viewed by VM objects in the kernel\n"
    "    -h, --help                            print this output\n";

struct Arguments {
    int32_t pid = 0;
    std::optional<std::string> file;
    bool force = false;
    bool breakDown = true;
};

bool fail(std::string_view subject, std::string_view what) {
    fmt::fprintf(stderr, "memweight-heapsnap: %s: %s\n", MWErrorText(subject), what);
    return false;
}

bool fail(std::string_view subject, int error) {
    return fail(subject, std::generic_category().message(error));
}

int usage(std::FILE* stream, int status) {
    std::fputs(kUsage, stream);
    return status;
}

/// None, and the exit status, when there is nothing to do.
std::optional<Arguments> parse(int argc, char* const argv[], int& status) {
    constexpr int kObjectDirty = 256;
    constexpr int kVersion = 257;
    static const option kOptions[] = {
        {"output", required_argument, nullptr, 'o'},           {"force", no_argument, nullptr, 'f'},
        {"vmObjectDirty", no_argument, nullptr, kObjectDirty}, {"help", no_argument, nullptr, 'h'},
        {"version", no_argument, nullptr, kVersion},           {nullptr, 0, nullptr, 0}};
    Arguments arguments;
    optind = 0;
    for (int option = 0; (option = getopt_long(argc, argv, "o:fh", kOptions, nullptr)) != -1;) {
        switch (option) {
            case 'o':
                arguments.file = optarg;
                break;
            case 'f':
                arguments.force = true;
                break;
            case kObjectDirty:
                arguments.breakDown = false;
                break;
            case 'h':
                status = usage(stdout, kSuccess);
                return std::nullopt;
            case kVersion:
                MWPrintVersion("memweight-heapsnap");
                status = kSuccess;
                return std::nullopt;
            default:
                status = usage(stderr, kFailure);
                return std::nullopt;
        }
    }
    if (optind + 1 != argc) {
        status = usage(stderr, kFailure);
        return std::nullopt;
    }
    const std::string_view text = argv[optind];
    const auto [end, error] = std::from_chars(text.data(), text.data() + text.size(), arguments.pid);
    if (error != std::errc() || end != text.data() + text.size() || arguments.pid <= 0) {
        fail(text, "not a pid");
        status = kFailure;
        return std::nullopt;
    }
    return arguments;
}

/// A process can call itself anything.
std::string defaultFile(const MWProcess& process) {
    std::string name = process.name();
    std::ranges::replace(name, '/', '_');
    return name + "-" + std::to_string(process.pid()) + ".heapsnap";
}

/// Whether a file of this name may be written: another one is replaced only by force, and nothing else than a
/// file ever.
bool mayWrite(const std::string& path, bool force) {
    struct stat status = {};
    if (lstat(path.c_str(), &status) != 0) {
        return errno == ENOENT || fail(path, errno);
    }
    if (!S_ISREG(status.st_mode)) {
        return fail(path, "not a regular file");
    }
    return force || fail(path, EEXIST);
}

bool rename(const std::string& from, const std::string& to, bool force) {
    const auto rename = [&](unsigned flags) {
        return renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), flags) == 0;
    };
    if (rename(force ? 0 : RENAME_NOREPLACE)) {
        return true;
    }
    // Not every file system can tell the two apart; that there was no such file has been seen before.
    return (!force && errno == EINVAL && rename(0)) || fail(to, errno);
}

bool writeSnapshot(MWRecordedProcess& process, MWOutputFile& file) {
    MWHeapsnapWriter writer(file, process.identity());
    process.record([&](const HeapsnapRegion& region) { writer.add(region); });
    writer.finish();
    for (const std::string& warning : process.warnings()) {
        fail("warning", warning);
    }
    const auto errors = process.errors();
    for (const std::string& error : errors) {
        fail("error", error);
    }
    return errors.empty();
}

bool save(MWRecordedProcess& process, const std::string& path, bool force) {
    if (!mayWrite(path, force)) {
        return false;
    }
    const std::string temporary = path + ".tmp" + std::to_string(getpid());
    const auto file = MWOutputFile::createNew(temporary);
    if (file == nullptr) {
        return fail(path, errno);
    }
    const bool isWhole = writeSnapshot(process, *file);
    const int error = file->finish();
    if (error != 0) {
        fail(path, error);
    }
    const bool isSaved = isWhole && error == 0 && rename(temporary, path, force);
    if (!isSaved) {
        unlink(temporary.c_str());
    }
    return isSaved;
}

}  // namespace

int MWHeapsnapMain(int argc, char* const argv[]) {
    int status = kSuccess;
    const auto arguments = parse(argc, argv, status);
    if (!arguments) {
        return status;
    }
    if (arguments->breakDown) {
        MWPhysMemweightSwitch::set(true);
    }
    const auto process = MWRecordedProcess::processWithPid(arguments->pid);
    if (process == nullptr) {
        fail(std::to_string(arguments->pid), "unable to read this process (try as root?)");
        return kFailure;
    }
    return save(*process, arguments->file.value_or(defaultFile(*process)), arguments->force) ? kSuccess
                                                                                             : kFailure;
}
