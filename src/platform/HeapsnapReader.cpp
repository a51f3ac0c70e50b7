#include "platform/HeapsnapReader.h"

#include <fmt/core.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <cstdio>
#include <iterator>
#include <limits>
#include <new>
#include <nlohmann/json.hpp>
#include <span>
#include <system_error>
#include <tuple>
#include <type_traits>
#include <unordered_map>
#include <utility>
#include <variant>
#include <vector>

namespace {

using SharedText = std::shared_ptr<const std::string>;

/// The document's own members beside those of the process.
struct Document : HeapsnapProcess {
    std::string format;
    uint32_t version = 0;
};

struct Region : HeapsnapRegion {
    std::string typeText;
    std::string pathText;
};

enum class Container : uint8_t { object, array };

/// What a member's value is stored in, whose type says what it has to be; or the container that it is.
template <class Record>
struct Member {
    using Field = std::variant<int32_t Record::*, uint8_t Record::*, uint16_t Record::*, uint32_t Record::*,
                               uint64_t Record::*, bool Record::*, std::string Record::*, Container>;

    std::string_view name;
    Field field;
    bool isRequired = false;
};

const Member<Document> kDocumentMembers[] = {
    {"format", &Document::format, true},          {"version", &Document::version, true},
    {"process", Container::object, true},         {"page_size", &Document::pageSize, true},
    {"breakdown", &Document::breakdown, true},    {"regions", Container::array, true},
    {"phys_memweight", &Document::physMemweight}, {"phys_memweight_peak", &Document::physMemweightPeak},
};
const Member<Document> kProcessMembers[] = {
    {"pid", &Document::pid, true},
    {"name", &Document::name, true},
    {"is64bit", &Document::is64bit, true},
    {"description", &Document::description, true},
    {"binary_images", &Document::binaryImages},
    {"shared_cache", &Document::hasSharedCache},
};
const Member<Region> kRegionMembers[] = {
    {"start", &Region::start, true},
    {"length", &Region::length, true},
    {"type", &Region::typeText},
    {"path", &Region::pathText},
    {"protection", &Region::protection},
    {"max_protection", &Region::maxProtection},
    {"offset", &Region::offset},
    {"user_tag", &Region::userTag},
    {"resident", &Region::resident},
    {"shared_now_private", &Region::sharedNowPrivate},
    {"swapped_out", &Region::swappedOut},
    {"dirty", &Region::dirty},
    {"reusable", &Region::reusable},
    {"ref_count", &Region::referenceCount},
    {"external_pager", &Region::externalPager},
    {"share_mode", &Region::shareMode},
    {"submap", &Region::submap},
    {"object_id", &Region::objectId},
    {"purgeable", &Region::purgeState},
};

/// None of them for what no member can be: null, and numbers that are negative, fractions or too large.
using Value = std::variant<std::monostate, uint64_t, bool, std::string, Container>;

template <class Field>
constexpr uint64_t kMost = static_cast<uint64_t>(std::numeric_limits<Field>::max());

/// Stores a value in fields of the type that it has; false for all others.
template <class Record>
class Store {
public:
    Store(Record& record, Value& value) : _record(record), _value(value) {}

    template <class Field>
    bool operator()(Field Record::*field) const {
        if constexpr (std::is_same_v<Field, bool> || std::is_same_v<Field, std::string>) {
            if (auto* value = std::get_if<Field>(&_value)) {
                _record.*field = std::move(*value);
                return true;
            }
        } else if (const auto* number = std::get_if<uint64_t>(&_value)) {
            _record.*field = static_cast<Field>(*number);
            return *number <= kMost<Field>;
        }
        return false;
    }
    bool operator()(Container container) const {
        const auto* value = std::get_if<Container>(&_value);
        return value != nullptr && *value == container;
    }

private:
    Record& _record;
    Value& _value;
};

/// What a field's value has to be.
template <class Record>
struct Expectation {
    template <class Field>
    std::string operator()(Field Record::*) const {
        if constexpr (std::is_same_v<Field, bool>) {
            return "true or false";
        } else if constexpr (std::is_same_v<Field, std::string>) {
            return "a text";
        } else {
            return fmt::format("a whole number from 0 to {}", kMost<Field>);
        }
    }
    std::string operator()(Container container) const {
        return container == Container::object ? "an object" : "an array";
    }
};

/// The members of one object while it is read into its record.
template <class Record>
class Members {
public:
    Members(std::span<const Member<Record>> members, Record& record) : _members(members), _record(record) {}

    void begin() { _seen = 0; }
    /// The member that the next value is for, unless nobody knows it; false when it has had one.
    bool select(std::string_view name) {
        const auto found = std::ranges::find(_members, name, &Member<Record>::name);
        _selected = found == _members.end() ? nullptr : &*found;
        const uint32_t bit = _selected == nullptr ? 0 : _bitOf(*_selected);
        const bool isSecond = (_seen & bit) != 0;
        _seen |= bit;
        return !isSecond;
    }
    bool isKnown() const { return _selected != nullptr; }
    bool set(Value value) { return std::visit(Store<Record>(_record, value), _selected->field); }
    std::string expected() const { return std::visit(Expectation<Record>(), _selected->field); }
    /// Empty when all that are required were there.
    std::string_view firstMissing() const {
        for (const Member<Record>& member : _members) {
            if (member.isRequired && (_seen & _bitOf(member)) == 0) {
                return member.name;
            }
        }
        return {};
    }

private:
    uint32_t _bitOf(const Member<Record>& member) const { return 1U << (&member - _members.data()); }

    std::span<const Member<Record>> _members;
    Record& _record;
    const Member<Record>* _selected = nullptr;
    uint32_t _seen = 0;
};

/// Takes the document in as the JSON parser meets its parts. An answer of false ends the parsing.
class Parser : public nlohmann::json_sax<nlohmann::json> {
    enum class Place : uint8_t { outside, document, process, regions, region };

    template <class Use>
    auto _inMembers(Use use) {
        switch (_place) {
            case Place::process:
                return use(_processMembers);
            case Place::region:
                return use(_regionMembers);
            default:
                return use(_documentMembers);
        }
    }

public:
    Document document;
    std::deque<HeapsnapRegion> regions;
    std::string error;  ///< empty while nothing is wrong

    bool null() override { return _scalar({}); }
    bool boolean(bool value) override { return _scalar(value); }
    bool number_unsigned(number_unsigned_t value) override { return _scalar(value); }
    bool number_integer(number_integer_t value) override {
        return _scalar(value < 0 ? Value() : Value(static_cast<uint64_t>(value)));
    }
    bool number_float(number_float_t, const string_t&) override { return _scalar({}); }
    bool string(string_t& value) override { return _scalar(std::move(value)); }
    bool binary(binary_t&) override { return _scalar({}); }
    bool start_object(size_t) override { return _begin(Container::object); }
    bool start_array(size_t) override { return _begin(Container::array); }
    bool end_object() override { return _end(); }
    bool end_array() override { return _end(); }
    bool key(string_t& name) override {
        if (_ignoredLevels != 0) {
            return true;
        }
        _key = name;
        return _inMembers([&](auto& members) { return members.select(name); }) || _fail("is there twice");
    }
    bool parse_error(size_t position, const std::string&, const nlohmann::detail::exception&) override {
        return _refuse(fmt::format("not valid JSON at byte {}", position));
    }

private:
    bool _refuse(std::string why) {
        error = std::move(why);
        return false;
    }
    std::string _element() const { return fmt::format("regions[{}]", regions.size()); }
    bool _fail(std::string_view what) {
        switch (_place) {
            case Place::outside:
                return _refuse(fmt::format("the document {}", what));
            case Place::document:
                return _refuse(fmt::format("{} {}", _key, what));
            case Place::process:
                return _refuse(fmt::format("process.{} {}", _key, what));
            case Place::regions:
                return _refuse(fmt::format("{} {}", _element(), what));
            case Place::region:
                return _refuse(fmt::format("{}.{} {}", _element(), _key, what));
        }
        return false;
    }

    bool _scalar(Value value) { return _ignoredLevels != 0 || _store(std::move(value)); }

    /// True also for a member that nobody knows.
    bool _store(Value value) {
        if (_place == Place::outside || _place == Place::regions) {
            return _fail("is not an object");
        }
        return _inMembers([&](auto& members) {
            return !members.isKnown() || members.set(std::move(value)) ||
                   _fail("is not " + members.expected());
        });
    }

    bool _begin(Container container) {
        const bool isPart = _place == Place::outside || _place == Place::regions;
        if (_ignoredLevels != 0 ||
            (!isPart && !_inMembers([](auto& members) { return members.isKnown(); }))) {
            return ++_ignoredLevels <= kDeepest ||
                   _refuse(fmt::format("nested deeper than {} levels", kDeepest));
        }
        if (!isPart) {
            if (!_store(container)) {
                return false;
            }
            _place = container == Container::object ? Place::process : Place::regions;
        } else if (container != Container::object) {
            return _fail("is not an object");
        } else {
            _place = _place == Place::outside ? Place::document : Place::region;
            _region = Region();
        }
        if (container == Container::object) {
            _inMembers([](auto& members) { members.begin(); });
        }
        return true;
    }

    bool _end() {
        if (_ignoredLevels != 0) {
            --_ignoredLevels;
            return true;
        }
        const Place ended = _place;
        if (ended != Place::regions) {
            _key = _inMembers([](auto& members) { return std::string(members.firstMissing()); });
            if (!_key.empty()) {
                return _fail("is missing");
            }
        }
        switch (ended) {
            case Place::region:
                _place = Place::regions;
                return _addRegion();
            case Place::document:
                _place = Place::outside;
                return _checkDocument();
            default:
                _place = Place::document;
                return true;
        }
    }

    // One past the last address is 2^64, which is 0.
    bool _addRegion() {
        const uint64_t end = _region.start + _region.length;
        if (end < _region.start && end != 0) {
            return _fail("ends behind the last address");
        }
        if (_region.start < _nextStart || (_isFull && _region.length != 0)) {
            return _fail("begins before the one before it ends");
        }
        _nextStart = std::max(end, _region.start);
        _isFull = _isFull || (end == 0 && _region.length != 0);
        _region.type = _shared(_region.typeText);
        _region.path = _shared(_region.pathText);
        regions.push_back(_region);
        return true;
    }

    bool _checkDocument() {
        if (document.format != "heapsnap") {
            return _refuse("format is not \"heapsnap\"");
        }
        if (document.version != 1) {
            return _refuse(fmt::format("version {} is not known", document.version));
        }
        return document.pageSize != 0 || _refuse("page_size is 0");
    }

    SharedText _shared(const std::string& text) {
        SharedText& shared = _texts[text];
        if (shared == nullptr) {
            shared = std::make_shared<const std::string>(text);
        }
        return shared;
    }

    static constexpr int kDeepest = 1000;

    Place _place = Place::outside;
    int _ignoredLevels = 0;  ///< of a value that nobody asked for
    std::string _key;
    Region _region;
    Members<Document> _documentMembers = Members<Document>(kDocumentMembers, document);
    Members<Document> _processMembers = Members<Document>(kProcessMembers, document);
    Members<Region> _regionMembers = Members<Region>(kRegionMembers, _region);
    uint64_t _nextStart = 0;
    bool _isFull = false;  ///< the last address is in a region
    std::unordered_map<std::string, SharedText> _texts;
};

/// The bytes of a source, one after the other, as the JSON parser takes them. The default is their end.
class ByteIterator {
public:
    using iterator_category = std::input_iterator_tag;
    using value_type = char;
    using difference_type = ptrdiff_t;
    using pointer = const char*;
    using reference = const char&;

    class Buffer {
    public:
        explicit Buffer(const HeapsnapReader::Source& source) : _source(source) { _fill(); }
        const char* at() const { return _at; }
        void advance() {
            if (++_at == _end) {
                _fill();
            }
        }

    private:
        void _fill() {
            const size_t count = _source(_bytes.data(), _bytes.size());
            _at = count == 0 ? nullptr : _bytes.data();
            _end = _bytes.data() + count;
        }

        const HeapsnapReader::Source& _source;
        std::vector<char> _bytes = std::vector<char>(size_t{1} << 18U);
        const char* _at = nullptr;  ///< none at the end
        const char* _end = nullptr;
    };

    ByteIterator() = default;
    explicit ByteIterator(Buffer& buffer) : _buffer(&buffer) {}
    reference operator*() const { return *_buffer->at(); }
    ByteIterator& operator++() {
        _buffer->advance();
        return *this;
    }
    void operator++(int) { _buffer->advance(); }
    bool operator==(const ByteIterator& other) const { return _atEnd() == other._atEnd(); }

private:
    bool _atEnd() const { return _buffer == nullptr || _buffer->at() == nullptr; }

    Buffer* _buffer = nullptr;
};

// Codes of HeapsnapReaderError.
constexpr int kMalformed = 1;
constexpr int kNoFile = 2;

MWError fileError(int code) {
    return {.domain = MWFileError, .code = code, .description = std::generic_category().message(code)};
}

}  // namespace

HeapsnapReader::Result HeapsnapReader::_read(const Source& source) try {
    Parser parser;
    ByteIterator::Buffer buffer(source);
    if (!nlohmann::json::sax_parse(ByteIterator(buffer), ByteIterator(), &parser)) {
        return tl::make_unexpected(MWError{HeapsnapReaderError, kMalformed, std::move(parser.error)});
    }
    std::unique_ptr<HeapsnapReader> reader(new HeapsnapReader);
    reader->_process = std::move(parser.document);
    reader->_regions = std::move(parser.regions);
    return reader;
} catch (const std::bad_alloc&) {
    return tl::make_unexpected(fileError(ENOMEM));
}

HeapsnapReader::Result HeapsnapReader::open(std::string_view bytes) {
    return _read([&](char* buffer, size_t size) {
        const size_t count = bytes.copy(buffer, size);
        bytes.remove_prefix(count);
        return count;
    });
}

// Opening a pipe would wait for somebody to write.
HeapsnapReader::Result HeapsnapReader::openFile(const std::string& path) {
    struct stat status = {};
    if (stat(path.c_str(), &status) != 0) {
        return tl::make_unexpected(fileError(errno));
    }
    if (S_ISDIR(status.st_mode)) {
        return tl::make_unexpected(fileError(EISDIR));
    }
    if (!S_ISREG(status.st_mode)) {
        return tl::make_unexpected(MWError{HeapsnapReaderError, kNoFile, "not a regular file"});
    }
    const std::unique_ptr<std::FILE, int (*)(std::FILE*)> file(std::fopen(path.c_str(), "rbe"), std::fclose);
    if (file == nullptr) {
        return tl::make_unexpected(fileError(errno));
    }
    int readError = 0;
    auto result = _read([&](char* buffer, size_t size) {
        errno = 0;
        const size_t count = std::fread(buffer, 1, size, file.get());
        readError = std::ferror(file.get()) != 0 ? errno : 0;
        return count;
    });
    return readError == 0 ? std::move(result) : tl::make_unexpected(fileError(readError));
}

void HeapsnapReader::enumerateRegions(const std::function<bool(const HeapsnapRegion&)>& visit) const {
    std::ignore = std::ranges::any_of(_regions, visit);
}
