#include "cli/MWHeapsnapEntry.h"

#include <fcntl.h>
#include <fmt/printf.h>
#include <getopt.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <system_error>

#include "cli/MWVersion.h"
#include "output/MWHeapsnapWriter.h"
#include "output/MWWholeFile.h"
#include "platform/MWHostInterface.h"
#include "platform/MWOutputPlace.h"
#include "platform/MWPhysMemweightSwitch.h"
#include "platform/MWTerminalText.h"
#include "platform/MWWorkQueue.h"
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

/// Another file is replaced only by force, and nothing else than a file ever.
bool mayWrite(const MWOutputPlace& place, const std::string& path, bool force) {
    struct stat status = {};
    if (fstatat(place.folder(), place.name().c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
        return errno == ENOENT || fail(path, errno);
    }
    if (!S_ISREG(status.st_mode)) {
        return fail(path, "not a regular file");
    }
    return force || fail(path, EEXIST);
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

/// What it runs can be given up, and then keeps what it works on.
MWConcurrentQueue watchedQueue() {
    return {"org.memweight.memweight.heapsnap", QOS_CLASS_USER_INITIATED};
}

/// None when the process cannot be read; the user has then been told.
std::shared_ptr<MWRecordedProcess> processToSave(int32_t pid) {
    const auto process = std::make_shared<std::shared_ptr<MWRecordedProcess>>();
    const auto stuck =
        watchedQueue().apply(1, [=](size_t) { *process = MWRecordedProcess::processWithPid(pid); });
    if (!stuck.empty()) {
        fail(std::to_string(pid), "not responding");
        return nullptr;
    }
    if (*process == nullptr) {
        fail(std::to_string(pid), "unable to read this process (try as root?)");
    }
    return *process;
}

bool writeWatched(const std::shared_ptr<MWRecordedProcess>& process,
                  const std::shared_ptr<MWWholeFile>& file) {
    const auto isWhole = std::make_shared<std::atomic<bool>>(false);
    const auto stuck =
        watchedQueue().apply(1, [=](size_t) { *isWhole = writeSnapshot(*process, file->contents()); });
    if (stuck.empty()) {
        return *isWhole;
    }
    file->giveUp();
    return fail(process->displayString(), "not responding");
}

bool save(const std::shared_ptr<MWRecordedProcess>& process, const std::string& path, bool force) {
    auto place = MWOutputPlace::find(path);
    if (!place) {
        return fail(path, errno);
    }
    if (!mayWrite(*place, path, force)) {
        return false;
    }
    const std::shared_ptr<MWWholeFile> file = MWWholeFile::create(*std::move(place));
    if (file == nullptr) {
        return fail(path, errno);
    }
    if (!writeWatched(process, file)) {
        return false;
    }
    const int error = file->publish(force);
    return error == 0 || fail(path, error);
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
    const auto process = processToSave(arguments->pid);
    if (process == nullptr) {
        return kFailure;
    }
    return save(process, arguments->file.value_or(defaultFile(*process)), arguments->force) ? kSuccess
                                                                                            : kFailure;
}
