#include "output/MWHeapsnapWriter.h"

MWHeapsnapWriter::MWHeapsnapWriter(MWOutputFile& file, const HeapsnapProcess& process) : _writer(&file) {
    _writer.beginObject();
    _text("format", "heapsnap");
    _number("version", 1);
    _writer.key("process");
    _writer.beginObject();
    _number("pid", static_cast<uint64_t>(process.pid));
    _text("name", process.name);
    _boolean("is64bit", process.is64bit);
    _text("description", process.description);
    _text("binary_images", process.binaryImages);
    _boolean("shared_cache", process.hasSharedCache);
    _writer.endObject();
    _number("page_size", process.pageSize);
    _number("phys_memweight", process.physMemweight);
    _number("phys_memweight_peak", process.physMemweightPeak);
    _boolean("breakdown", process.breakdown);
    _writer.key("regions");
    _writer.beginArray();
}

void MWHeapsnapWriter::add(const HeapsnapRegion& region) {
    _writer.beginObject();
    _number("start", region.start);
    _number("length", region.length);
    _text("type", *region.type);
    _text("path", *region.path);
    _number("protection", region.protection);
    _number("max_protection", region.maxProtection);
    _number("offset", region.offset);
    _number("user_tag", region.userTag);
    _number("resident", region.resident);
    _number("shared_now_private", region.sharedNowPrivate);
    _number("swapped_out", region.swappedOut);
    _number("dirty", region.dirty);
    _number("reusable", region.reusable);
    _number("ref_count", region.referenceCount);
    _boolean("external_pager", region.externalPager);
    _number("share_mode", region.shareMode);
    _number("submap", region.submap);
    _number("object_id", region.objectId);
    _number("purgeable", region.purgeState);
    _writer.endObject();
}

void MWHeapsnapWriter::finish() {
    _writer.endArray();
    _writer.endObject();
    _writer.flush();
}

void MWHeapsnapWriter::_number(std::string_view key, uint64_t value) {
    _writer.key(key);
    _writer.number(value);
}

void MWHeapsnapWriter::_text(std::string_view key, std::string_view value) {
    _writer.key(key);
    _writer.string(value);
}

void MWHeapsnapWriter::_boolean(std::string_view key, bool value) {
    _writer.key(key);
    _writer.boolean(value);
}
