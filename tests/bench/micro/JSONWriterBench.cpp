#include <benchmark/benchmark.h>
#include <fcntl.h>

#include <string>
#include <string_view>

#include "output/MWJSONWriter.h"
#include "output/MWOutputFile.h"

namespace {

constexpr std::string_view kPlain = "/usr/lib/x86_64-linux-gnu/liblibrary.so.6";
constexpr std::string_view kEscaped = "/srv/\"data\"/\n\x01 \\ \xc3\xa9\xff/file with \xe2\x82\xac";

// What a report has of each region.
void writeRegion(MWJSONWriter& json, std::string_view path, uint64_t number) {
    json.beginObject();
    for (const char* key : {"start", "dirty", "swapped", "clean"}) {
        json.key(key);
        json.number(0x7f0000000000 + number);
    }
    json.key("name");
    json.string(path);
    json.key("wired");
    json.boolean(false);
    json.endObject();
}

void writeJSON(benchmark::State& state, std::string_view path) {
    constexpr uint64_t kRegions = 100000;
    MWOutputFile file("null", open("/dev/null", O_WRONLY | O_CLOEXEC));
    size_t sizeOfRegion = 0;
    for (auto iteration : state) {
        MWJSONWriter json(&file);
        json.beginArray();
        writeRegion(json, path, 0);
        sizeOfRegion = json.text().size();
        for (uint64_t region = 1; region < kRegions; ++region) {
            writeRegion(json, path, region);
        }
        json.endArray();
        json.flush();
    }
    if (file.error() != 0) {
        state.SkipWithError("not all was written");
    }
    state.SetItemsProcessed(state.iterations() * kRegions);
    state.SetBytesProcessed(state.iterations() * static_cast<int64_t>(kRegions * sizeOfRegion));
}

BENCHMARK_CAPTURE(writeJSON, plain, kPlain)->Unit(benchmark::kMillisecond);
BENCHMARK_CAPTURE(writeJSON, escaped, kEscaped)->Unit(benchmark::kMillisecond);

}  // namespace
