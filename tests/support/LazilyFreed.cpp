#include "support/LazilyFreed.h"

#include <sched.h>
#include <sys/mount.h>
#include <unistd.h>

#include <cstdlib>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <string>

size_t coverLazilyFreed() {
    constexpr std::string_view kName = "\npglazyfree ";
    std::ifstream file("/proc/vmstat");
    std::string text((std::istreambuf_iterator<char>(file)), std::istreambuf_iterator<char>());
    const size_t line = text.find(kName);
    const size_t at = line + kName.size();
    const size_t pages = line == std::string::npos ? 0 : std::strtoull(text.c_str() + at, nullptr, 10);
    if (pages == 0) {
        return 0;
    }
    text.replace(at, text.find('\n', at) - at, "0");
    const std::string cover = "/run/memweight-vmstat." + std::to_string(getpid());
    std::ofstream(cover) << text;
    const bool covered = unshare(CLONE_NEWNS) == 0 &&
                         mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
                         mount(cover.c_str(), "/proc/vmstat", nullptr, MS_BIND, nullptr) == 0;
    unlink(cover.c_str());
    if (!covered) {
        throw std::runtime_error("cannot cover /proc/vmstat");
    }
    return pages;
}
