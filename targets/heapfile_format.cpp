#include "targets/heapfile_format.h"

#include <cinttypes>
#include <cstdio>
#include <limits>
#include <nlohmann/json.hpp>

#include "model/memory_region.h"
#include "model/utf8.h"
#include "targets/platform/platform.h"

using nlohmann::json;

namespace {

// A heapfile is flat: the document, the region list and one object per
// region. Anything nested deeper is not ours, and refusing it before
// parsing keeps a hostile file from costing unbounded work.
constexpr int kMaxNesting = 16;

// Exact bytes of a text, two lower-case hex digits each.
std::string toHex(std::string_view bytes) {
    static constexpr char kDigits[] = "0123456789abcdef";
    std::string out;
    out.reserve(bytes.size() * 2);
    for (const char c : bytes) {
        out += kDigits[static_cast<unsigned char>(c) >> 4];
        out += kDigits[static_cast<unsigned char>(c) & 0xF];
    }
    return out;
}

std::optional<std::string> fromHex(std::string_view digits) {
    auto value = [](char c) -> int {
        if (c >= '0' && c <= '9') return c - '0';
        if (c >= 'a' && c <= 'f') return c - 'a' + 10;
        if (c >= 'A' && c <= 'F') return c - 'A' + 10;
        return -1;
    };
    if (digits.size() % 2 != 0) {
        return std::nullopt;
    }
    std::string bytes;
    bytes.reserve(digits.size() / 2);
    for (size_t i = 0; i < digits.size(); i += 2) {
        const int high = value(digits[i]);
        const int low = value(digits[i + 1]);
        if (high < 0 || low < 0) {
            return std::nullopt;
        }
        bytes.push_back(static_cast<char>(high << 4 | low));
    }
    return bytes;
}

std::string hex(uint64_t value) {
    char buffer[24];
    std::snprintf(buffer, sizeof(buffer), "0x%" PRIx64, value);
    return buffer;
}

// Texts from the system need not be valid UTF-8 (Linux names are bytes):
// such bytes become U+FFFD rather than failing the whole document.
template <typename Json>
std::string jsonText(const Json &value) {
    return value.dump(-1, ' ', false, Json::error_handler_t::replace);
}

std::string jsonQuoted(std::string_view text) { return jsonText(json(std::string(text))); }

// Depth of [ and { outside strings, or -1 past kMaxNesting.
int maximumNesting(std::string_view bytes) {
    int depth = 0;
    int deepest = 0;
    bool inString = false;
    bool escaped = false;
    for (char c : bytes) {
        if (inString) {
            if (escaped) {
                escaped = false;
            } else if (c == '\\') {
                escaped = true;
            } else if (c == '"') {
                inString = false;
            }
            continue;
        }
        if (c == '"') {
            inString = true;
        } else if (c == '[' || c == '{') {
            if (++depth > kMaxNesting) {
                return -1;
            }
            deepest = std::max(deepest, depth);
        } else if (c == ']' || c == '}') {
            --depth;
        }
    }
    return deepest;
}

// Reads typed values out of one JSON object and records the first problem.
class FieldReader {
public:
    FieldReader(const json &object, std::string context, vs::HeapfileError *error)
        : _object(object), _context(std::move(context)), _error(error) {}

    bool failed() const { return _failed; }

    void fail(int64_t code, const std::string &what) {
        if (_failed) {
            return;
        }
        _failed = true;
        if (_error != nullptr) {
            *_error = {std::string(vs::kHeapfileErrorDomain), code, _context + what};
        }
    }

    // A non-negative integer up to `maximum`: a JSON integer, or a string
    // holding a decimal or "0x" hexadecimal number (addresses above 2^53
    // do not survive every JSON tool as numbers).
    std::optional<uint64_t> unsignedValue(const char *key, uint64_t maximum) {
        const json *value = _find(key);
        if (value == nullptr) {
            return std::nullopt;
        }
        uint64_t number = 0;
        if (value->is_number_unsigned()) {
            number = value->get<uint64_t>();
        } else if (value->is_number_integer()) {
            fail(vs::kHeapfileErrorBadValue, _name(key) + " is negative (" + value->dump() + ")");
            return std::nullopt;
        } else if (value->is_string()) {
            const std::string &text = value->get_ref<const std::string &>();
            if (!_parseNumberText(text, number)) {
                fail(vs::kHeapfileErrorBadValue, _name(key) + " is not a number (" + jsonQuoted(text) + ")");
                return std::nullopt;
            }
        } else {
            fail(vs::kHeapfileErrorBadValue,
                 _name(key) + " is not a non-negative integer (" + _describe(*value) + ")");
            return std::nullopt;
        }
        if (number > maximum) {
            fail(vs::kHeapfileErrorBadValue,
                 _name(key) + " is " + std::to_string(number) + ", above its limit " + std::to_string(maximum));
            return std::nullopt;
        }
        return number;
    }

    // A signed 32-bit integer.
    std::optional<int32_t> signed32(const char *key) {
        const json *value = _find(key);
        if (value == nullptr) {
            return std::nullopt;
        }
        if (!value->is_number_integer()) {
            fail(vs::kHeapfileErrorBadValue, _name(key) + " is not an integer (" + _describe(*value) + ")");
            return std::nullopt;
        }
        if (value->is_number_unsigned() && value->get<uint64_t>() > uint64_t(std::numeric_limits<int32_t>::max())) {
            fail(vs::kHeapfileErrorBadValue, _name(key) + " is out of range (" + value->dump() + ")");
            return std::nullopt;
        }
        const int64_t number = value->get<int64_t>();
        if (number < std::numeric_limits<int32_t>::min() || number > std::numeric_limits<int32_t>::max()) {
            fail(vs::kHeapfileErrorBadValue, _name(key) + " is out of range (" + value->dump() + ")");
            return std::nullopt;
        }
        return static_cast<int32_t>(number);
    }

    // A boolean: true/false, or the integers 0 and 1.
    std::optional<bool> flag(const char *key) {
        const json *value = _find(key);
        if (value == nullptr) {
            return std::nullopt;
        }
        if (value->is_boolean()) {
            return value->get<bool>();
        }
        if (value->is_number_unsigned() && value->get<uint64_t>() <= 1) {
            return value->get<uint64_t>() == 1;
        }
        fail(vs::kHeapfileErrorBadValue, _name(key) + " is not true or false (" + _describe(*value) + ")");
        return std::nullopt;
    }

    std::optional<std::string> text(const char *key) {
        const json *value = _find(key);
        if (value == nullptr) {
            return std::nullopt;
        }
        if (!value->is_string()) {
            fail(vs::kHeapfileErrorBadValue, _name(key) + " is not a string (" + _describe(*value) + ")");
            return std::nullopt;
        }
        return _exactBytes(key, value->get<std::string>());
    }

    // An optional string: absent and null both mean "none". The outer
    // optional is empty only on a bad value.
    std::optional<std::optional<std::string>> optionalText(const char *key) {
        const auto found = _object.find(key);
        if (found == _object.end() || found->is_null()) {
            return std::optional<std::string>();
        }
        if (!found->is_string()) {
            fail(vs::kHeapfileErrorBadValue, _name(key) + " is not a string (" + _describe(*found) + ")");
            return std::nullopt;
        }
        const std::optional<std::string> exact = _exactBytes(key, found->get<std::string>());
        if (!exact) {
            return std::nullopt;
        }
        return std::optional<std::string>(*exact);
    }

private:
    // A text that was not UTF-8 when written comes with its exact bytes
    // under KEYBytes (hex): those win over the readable form.
    std::optional<std::string> _exactBytes(const char *key, std::string readable) {
        const std::string bytesKey = std::string(key) + "Bytes";
        const auto found = _object.find(bytesKey);
        if (found == _object.end()) {
            return readable;
        }
        std::optional<std::string> bytes = found->is_string() ? fromHex(found->get_ref<const std::string &>())
                                                              : std::nullopt;
        if (!bytes) {
            fail(vs::kHeapfileErrorBadValue, _name(bytesKey.c_str()) + " is not hex digits (" + _describe(*found) + ")");
        }
        return bytes;
    }

    const json *_find(const char *key) {
        if (_failed) {
            return nullptr;
        }
        const auto found = _object.find(key);
        if (found == _object.end()) {
            fail(vs::kHeapfileErrorMissingKey, "missing key " + _name(key));
            return nullptr;
        }
        return &*found;
    }

    static std::string _name(const char *key) {
        // Appending, not operator+ on a literal: g++ 12 at -O3 warns falsely
        // about overlapping copies there.
        std::string quoted(1, '"');
        quoted.append(key).push_back('"');
        return quoted;
    }

    static std::string _describe(const json &value) {
        std::string text = value.dump();
        if (text.size() > 40) {
            text = text.substr(0, 37) + "...";
        }
        return text;
    }

    static bool _parseNumberText(const std::string &text, uint64_t &number) {
        size_t position = 0;
        unsigned base = 10;
        if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
            position = 2;
            base = 16;
        }
        if (position == text.size()) {
            return false;
        }
        uint64_t result = 0;
        for (; position < text.size(); ++position) {
            const char c = text[position];
            unsigned digit;
            if (c >= '0' && c <= '9') {
                digit = unsigned(c - '0');
            } else if (base == 16 && c >= 'a' && c <= 'f') {
                digit = unsigned(c - 'a' + 10);
            } else if (base == 16 && c >= 'A' && c <= 'F') {
                digit = unsigned(c - 'A' + 10);
            } else {
                return false;
            }
            if (result > (std::numeric_limits<uint64_t>::max() - digit) / base) {
                return false;  // does not fit 64 bits
            }
            result = result * base + digit;
        }
        number = result;
        return true;
    }

    const json &_object;
    std::string _context;
    vs::HeapfileError *_error;
    bool _failed = false;
};

void setError(vs::HeapfileError *error, int64_t code, std::string description) {
    if (error != nullptr) {
        *error = {std::string(vs::kHeapfileErrorDomain), code, std::move(description)};
    }
}

bool isPowerOfTwo(uint64_t value) { return value != 0 && (value & (value - 1)) == 0; }

std::optional<VSHeapfileRegion> readRegion(const json &object, size_t index, vs::HeapfileError *error) {
    const std::string context = "region " + std::to_string(index) + ": ";
    if (!object.is_object()) {
        setError(error, vs::kHeapfileErrorBadValue, context + "not a JSON object");
        return std::nullopt;
    }
    FieldReader fields(object, context, error);
    VSHeapfileRegion region;
    constexpr uint64_t kMax64 = std::numeric_limits<uint64_t>::max();
    region.address = fields.unsignedValue("address", kMax64).value_or(0);
    region.length = fields.unsignedValue("length", kMax64).value_or(0);
    region.type = fields.text("type").value_or("");
    region.path = fields.optionalText("path").value_or(std::nullopt);
    region.protection = fields.signed32("protection").value_or(0);
    region.maxProtection = fields.signed32("maxProtection").value_or(0);
    region.userTag = static_cast<uint32_t>(fields.unsignedValue("userTag", UINT32_MAX).value_or(0));
    region.userTagName = fields.optionalText("userTagName").value_or(std::nullopt);
    region.residentBytes = fields.unsignedValue("residentBytes", kMax64).value_or(0);
    region.sharedNowPrivateBytes = fields.unsignedValue("sharedNowPrivateBytes", kMax64).value_or(0);
    region.swappedBytes = fields.unsignedValue("swappedBytes", kMax64).value_or(0);
    region.dirtyBytes = fields.unsignedValue("dirtyBytes", kMax64).value_or(0);
    region.referenceCount = static_cast<uint16_t>(fields.unsignedValue("referenceCount", UINT16_MAX).value_or(0));
    region.externalPager = fields.flag("externalPager").value_or(false) ? 1 : 0;
    region.shareMode = static_cast<uint8_t>(fields.unsignedValue("shareMode", UINT8_MAX).value_or(0));
    region.submap = fields.flag("submap").value_or(false) ? 1 : 0;
    region.objectId = fields.unsignedValue("objectId", kMax64).value_or(0);
    if (object.contains("offset")) {
        region.offset = fields.unsignedValue("offset", kMax64).value_or(0);
    }
    region.purgeableState = static_cast<int32_t>(fields.unsignedValue("purgeableState", 3).value_or(3));
    if (fields.failed()) {
        return std::nullopt;
    }

    const std::string where = "region " + std::to_string(index) + " (" + hex(region.address) + "): ";
    if (region.length == 0) {
        setError(error, vs::kHeapfileErrorBadValue, where + "length is 0");
        return std::nullopt;
    }
    if (region.end() < region.address) {
        setError(error, vs::kHeapfileErrorBadValue,
                 where + "ends below its start (length " + hex(region.length) + " runs past the top of the address space)");
        return std::nullopt;
    }
    const std::pair<const char *, uint64_t> counts[] = {
        {"residentBytes", region.residentBytes},
        {"sharedNowPrivateBytes", region.sharedNowPrivateBytes},
        {"swappedBytes", region.swappedBytes},
        {"dirtyBytes", region.dirtyBytes},
    };
    for (const auto &[key, bytes] : counts) {
        if (bytes > region.length) {
            setError(error, vs::kHeapfileErrorInconsistent,
                     where + "\"" + key + "\" " + std::to_string(bytes) + " is larger than the region (" +
                         std::to_string(region.length) + " bytes)");
            return std::nullopt;
        }
    }
    return region;
}

}  // namespace

namespace vs {

std::optional<VSHeapfileSnapshot> parseHeapfile(std::string_view bytes, HeapfileError *error) {
    if (bytes.empty()) {
        setError(error, kHeapfileErrorEmpty, "the file is empty");
        return std::nullopt;
    }
    if (maximumNesting(bytes) < 0) {
        setError(error, kHeapfileErrorNotHeapfile,
                 "not a vestage heapfile (JSON nested deeper than " + std::to_string(kMaxNesting) + " levels)");
        return std::nullopt;
    }
    json document;
    try {
        document = json::parse(bytes.begin(), bytes.end());
    } catch (const json::parse_error &failure) {
        // The parser reports the byte it stopped at; at or past the end the
        // document was cut short rather than malformed.
        if (failure.byte >= bytes.size()) {
            setError(error, kHeapfileErrorSyntax,
                     "the JSON document is truncated (it ends after " + std::to_string(bytes.size()) + " bytes)");
        } else {
            setError(error, kHeapfileErrorSyntax,
                     "not a JSON document (syntax error at byte " + std::to_string(failure.byte) + ")");
        }
        return std::nullopt;
    } catch (const json::exception &failure) {
        // A well-formed document the library still refuses, e.g. a number
        // beyond the range of a double.
        setError(error, kHeapfileErrorSyntax, std::string("not a usable JSON document (") + failure.what() + ")");
        return std::nullopt;
    }
    if (!document.is_object()) {
        setError(error, kHeapfileErrorNotHeapfile, "not a vestage heapfile (the document is not a JSON object)");
        return std::nullopt;
    }

    const auto format = document.find("format");
    if (format == document.end()) {
        setError(error, kHeapfileErrorNotHeapfile, "not a vestage heapfile (no \"format\" key)");
        return std::nullopt;
    }
    if (!format->is_string() || format->get_ref<const std::string &>() != kHeapfileFormatName) {
        setError(error, kHeapfileErrorNotHeapfile,
                 "not a vestage heapfile (\"format\" is " + format->dump() + ", expected " +
                     jsonQuoted(kHeapfileFormatName) + ")");
        return std::nullopt;
    }
    const auto version = document.find("version");
    if (version == document.end()) {
        setError(error, kHeapfileErrorMissingKey, "missing key \"version\"");
        return std::nullopt;
    }
    if (!version->is_number_integer() || version->get<int64_t>() < kOldestHeapfileVersion ||
        version->get<int64_t>() > kHeapfileVersion) {
        setError(error, kHeapfileErrorVersion,
                 "heapfile version " + version->dump() + " is not supported (this vestage reads version " +
                     std::to_string(kHeapfileVersion) + ")");
        return std::nullopt;
    }

    FieldReader fields(document, "", error);
    VSHeapfileSnapshot snapshot;
    const std::optional<uint64_t> pid = fields.unsignedValue("pid", uint64_t(std::numeric_limits<int32_t>::max()));
    snapshot.pid = static_cast<int32_t>(pid.value_or(0));
    snapshot.name = fields.text("name").value_or("");
    snapshot.description = fields.text("description").value_or("");
    const std::optional<uint64_t> pointerWidth = fields.unsignedValue("pointerWidth", 64);
    const std::optional<uint64_t> pageSize = fields.unsignedValue("pageSize", UINT32_MAX);
    snapshot.physVestage = fields.unsignedValue("physVestage", UINT64_MAX).value_or(0);
    snapshot.physVestagePeak = fields.unsignedValue("physVestagePeak", UINT64_MAX).value_or(0);
    snapshot.breakDownPhysVestage = fields.flag("breakDownPhysVestage").value_or(false);
    if (fields.failed()) {
        return std::nullopt;
    }
    if (*pointerWidth != 32 && *pointerWidth != 64) {
        setError(error, kHeapfileErrorBadValue,
                 "\"pointerWidth\" is " + std::to_string(*pointerWidth) + ", expected 32 or 64");
        return std::nullopt;
    }
    snapshot.is64bit = *pointerWidth == 64;
    if (!isPowerOfTwo(*pageSize)) {
        setError(error, kHeapfileErrorBadValue,
                 "\"pageSize\" is " + std::to_string(*pageSize) + ", not a power of two");
        return std::nullopt;
    }
    snapshot.pageSize = static_cast<uint32_t>(*pageSize);

    const auto regions = document.find("regions");
    if (regions == document.end()) {
        setError(error, kHeapfileErrorMissingKey, "missing key \"regions\"");
        return std::nullopt;
    }
    if (!regions->is_array()) {
        setError(error, kHeapfileErrorBadValue, "\"regions\" is not a list");
        return std::nullopt;
    }
    snapshot.regions.reserve(regions->size());
    for (size_t index = 0; index < regions->size(); ++index) {
        std::optional<VSHeapfileRegion> region = readRegion((*regions)[index], index, error);
        if (!region) {
            return std::nullopt;
        }
        // The walk and the image lookup both depend on ascending order; a
        // mapping's parts repeat its range one after the other.
        const bool part = !snapshot.regions.empty() && region->address == snapshot.regions.back().address &&
                          region->length == snapshot.regions.back().length;
        if (!snapshot.regions.empty() && !part && region->address < snapshot.regions.back().end()) {
            setError(error, kHeapfileErrorInconsistent,
                     "region " + std::to_string(index) + " (" + hex(region->address) +
                         ") starts before the end of region " + std::to_string(index - 1) + " (" +
                         hex(snapshot.regions.back().end()) + ")");
            return std::nullopt;
        }
        snapshot.regions.push_back(std::move(*region));
    }
    return snapshot;
}

std::string heapfileText(const VSHeapfileSnapshot &snapshot) {
    std::string out = "{\n";
    auto line = [&out](const char *key, const json &value, bool last = false) {
        out += "  \"";
        out += key;
        out += "\": ";
        out += jsonText(value);
        out += last ? "\n" : ",\n";
    };
    line("format", std::string(kHeapfileFormatName));
    line("version", kHeapfileVersion);
    line("pid", snapshot.pid);
    line("name", snapshot.name);
    if (!isUtf8(snapshot.name)) {
        line("nameBytes", toHex(snapshot.name));
    }
    line("description", snapshot.description);
    if (!isUtf8(snapshot.description)) {
        line("descriptionBytes", toHex(snapshot.description));
    }
    line("pointerWidth", snapshot.is64bit ? 64 : 32);
    line("pageSize", snapshot.pageSize);
    line("physVestage", snapshot.physVestage);
    line("physVestagePeak", snapshot.physVestagePeak);
    line("breakDownPhysVestage", snapshot.breakDownPhysVestage);
    out += "  \"regions\": [";
    for (size_t index = 0; index < snapshot.regions.size(); ++index) {
        const VSHeapfileRegion &region = snapshot.regions[index];
        nlohmann::ordered_json object;
        object["address"] = hex(region.address);
        object["length"] = hex(region.length);
        object["type"] = region.type;
        object["path"] = region.path ? json(*region.path) : json(nullptr);
        if (region.path && !isUtf8(*region.path)) {
            object["pathBytes"] = toHex(*region.path);
        }
        object["protection"] = region.protection;
        object["maxProtection"] = region.maxProtection;
        object["userTag"] = region.userTag;
        if (region.userTagName) {
            object["userTagName"] = *region.userTagName;
            if (!isUtf8(*region.userTagName)) {
                object["userTagNameBytes"] = toHex(*region.userTagName);
            }
        }
        object["residentBytes"] = region.residentBytes;
        object["sharedNowPrivateBytes"] = region.sharedNowPrivateBytes;
        object["swappedBytes"] = region.swappedBytes;
        object["dirtyBytes"] = region.dirtyBytes;
        object["referenceCount"] = region.referenceCount;
        object["externalPager"] = region.externalPager != 0;
        object["shareMode"] = region.shareMode;
        object["submap"] = (region.submap & 1) != 0;
        object["objectId"] = region.objectId;
        if (region.offset != 0) {
            object["offset"] = region.offset;
        }
        object["purgeableState"] = region.purgeableState;
        out += index == 0 ? "\n    " : ",\n    ";
        out += jsonText(object);
    }
    out += snapshot.regions.empty() ? "]\n" : "\n  ]\n";
    out += "}\n";
    return out;
}

uint64_t platformCodeForHeapfileDescription(std::string_view description) {
    if (description.find("no shared region") != std::string_view::npos) {
        return VSPlatformNone;
    }
    if (description.find("X86-64") != std::string_view::npos) {
        return VSPlatformX86_64;
    }
    if (description.find("X86") != std::string_view::npos) {
        return VSPlatformX86;
    }
    if (const size_t arm64 = description.find("ARM64"); arm64 != std::string_view::npos) {
        const size_t after = arm64 + 5;
        if (after + 2 < description.size() && description.substr(after, 3) == "-32") {
            return VSPlatformARM64_32;
        }
        return VSPlatformARM64;
    }
    if (description.find("ARM") != std::string_view::npos) {
        return VSPlatformARM;
    }
    return VSPlatformUnknown;
}

}  // namespace vs

std::unique_ptr<VSHeapfileReader> VSHeapfileReader::openFromData(std::string_view bytes, vs::HeapfileError *error) {
    std::optional<VSHeapfileSnapshot> snapshot = vs::parseHeapfile(bytes, error);
    if (!snapshot) {
        return nullptr;
    }
    // Tags handed out at run time mean nothing in another run: the name is
    // what was recorded, this run's tag for it is what the walk needs.
    for (VSHeapfileRegion &region : snapshot->regions) {
        if (region.userTagName && region.userTag >= vs::kFirstDynamicTag &&
            region.userTag != vs::kTagNonVolatilePhysVestage) {
            region.userTag = vs::registerDynamicTagName(*region.userTagName);
        }
    }
    return std::make_unique<VSHeapfileReader>(std::move(*snapshot));
}

void VSHeapfileReader::enumerateRegions(
    const std::function<void(const VSHeapfileRegion &region, bool &stop)> &callback) const {
    bool stop = false;
    for (const VSHeapfileRegion &region : _snapshot.regions) {
        callback(region, stop);
        if (stop) {
            return;
        }
    }
}
