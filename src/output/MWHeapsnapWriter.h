#pragma once

#include "output/MWJSONWriter.h"
#include "platform/HeapsnapReader.h"

class MWOutputFile;

/// Writes a snapshot, region by region, as the document that HeapsnapReader reads.
class MWHeapsnapWriter {
public:
    /// `file` outlives the writer.
    MWHeapsnapWriter(MWOutputFile& file, const HeapsnapProcess& process);
    /// In ascending order.
    void add(const HeapsnapRegion& region);
    void finish();

private:
    void _number(std::string_view key, uint64_t value);
    void _text(std::string_view key, std::string_view value);
    void _boolean(std::string_view key, bool value);

    MWJSONWriter _writer;
};
