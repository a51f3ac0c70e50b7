#pragma once

#include <fmt/format.h>

#include <algorithm>
#include <cstdint>
#include <functional>
#include <map>
#include <span>
#include <string>
#include <vector>

#include "platform/linux/PageCounts.h"
#include "support/WrittenPages.h"

/// A mapping whose pages are written as one letter each: P the process's own, S shared by fork, F a file's or
/// of shared memory, K the kernel's without a page of its own, w swapped, z the zero page, . absent.
struct WrittenMapping {
    uint64_t firstPage;
    std::string letters;
    Backing backing = Backing::anonymous;
    std::string permissions = "rw-p";
    std::string path = {};
};

/// A process as `maps` and a scan of its pages tell it. Answers as the kernel does: ranges of equal
/// categories go on across mappings, and only what was asked for is told.
class ScannedProcess {
public:
    static constexpr uint64_t kPage = 4096;

    explicit ScannedProcess(const std::vector<WrittenMapping>& mappings) {
        _texts.reserve(mappings.size());
        for (const WrittenMapping& mapping : mappings) {
            _add(mapping);
        }
    }
    ScannedProcess(const ScannedProcess&) = delete;
    ScannedProcess& operator=(const ScannedProcess&) = delete;

    std::vector<BackedVma> vmas;
    WrittenPages pages;
    std::vector<PageScan> questions;
    uint64_t mostPages = UINT64_MAX;  ///< the kernel stops of itself behind so many

    PageScanner scanner() {
        return [this](const PageScan& scan, std::span<ScannedRange> ranges, uint64_t& walkEnd) {
            return _scan(scan, ranges, walkEnd);
        };
    }

    /// "RSS/ANONYMOUS/SWAP" in pages, of each mapping.
    std::vector<std::string> counts() const {
        std::vector<std::string> texts;
        for (const BackedVma& backed : vmas) {
            const procfs::Vma& vma = backed.vma;
            texts.push_back(
                fmt::format("{}/{}/{}", vma.rss / kPage, vma.anonymous / kPage, vma.swap / kPage));
        }
        return texts;
    }

private:
    void _add(const WrittenMapping& mapping) {
        const uint64_t start = mapping.firstPage * kPage;
        const bool isFile = mapping.path.starts_with('/');
        const uint64_t inode = isFile ? std::hash<std::string>()(mapping.path) : 0;
        procfs::Vma& vma = _texts.emplace_back(
            procfs::parseSmaps(fmt::format("{:x}-{:x} {} {:x} {} {} {}", start,
                                           start + mapping.letters.size() * kPage, mapping.permissions,
                                           isFile ? start : 0, isFile ? "08:00" : "00:00", inode,
                                           mapping.path))
                .front());
        vmas.push_back({vma, mapping.backing});
        for (size_t page = 0; page < mapping.letters.size(); ++page) {
            _addPage(vma.start + page * kPage, mapping.letters[page]);
        }
    }

    void _addPage(uint64_t address, char letter) {
        const auto bits = [letter](const char* letters, uint64_t value) {
            return std::string_view(letters).find(letter) == std::string_view::npos ? uint64_t{0} : value;
        };
        const uint64_t categories = bits("PSFKz", kIsPresent) | bits("w", kIsSwapped) |
                                    bits("z", kIsZeroPage) | bits("F", kIsFileOrShared);
        if (categories != 0) {
            _categories[address] = categories;
            pages.pages[address] = {bits("PSFKz", uint64_t{1} << 63U) | bits("w", uint64_t{1} << 62U) |
                                    bits("F", uint64_t{1} << 61U) | bits("P", uint64_t{1} << 56U)};
        }
    }

    int _scan(const PageScan& scan, std::span<ScannedRange> ranges, uint64_t& walkEnd) {
        questions.push_back(scan);
        const uint64_t most = std::min(mostPages, scan.mostPages == 0 ? UINT64_MAX : scan.mostPages);
        size_t count = 0;
        uint64_t told = 0;
        for (auto page = _categories.lower_bound(scan.start);
             page != _categories.end() && page->first < scan.end; ++page) {
            const auto& [address, categories] = *page;
            if ((categories & scan.anyOf) == 0) {
                continue;
            }
            const uint64_t answer = categories & scan.told;
            const bool goesOn =
                count != 0 && ranges[count - 1].end == address && ranges[count - 1].categories == answer;
            if (told == most || (!goesOn && count == ranges.size())) {
                walkEnd = address;
                return static_cast<int>(count);
            }
            ++told;
            if (goesOn) {
                ranges[count - 1].end += kPage;
            } else {
                ranges[count++] = {address, address + kPage, answer};
            }
        }
        walkEnd = scan.end;
        return static_cast<int>(count);
    }

    std::vector<procfs::Vma> _texts;
    std::map<uint64_t, uint64_t> _categories;
};
