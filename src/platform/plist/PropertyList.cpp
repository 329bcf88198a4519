#include "platform/plist/PropertyList.h"

#include <fcntl.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>
#include <vector>

#include "platform/fd/UniqueFd.h"
#include "platform/plist/StructureCheck.h"
#include "platform/value/Utf8.h"

namespace qm::plist {

namespace {

struct PlistFree {
    void operator()(void* node) const {
        if (node) {
            plist_free(node);
        }
    }
};
using PlistPtr = std::unique_ptr<void, PlistFree>;

// libplist allocates iterators, keys and output buffers with malloc.
struct MallocFree {
    void operator()(void* p) const { std::free(p); }
};
using MallocPtr = std::unique_ptr<void, MallocFree>;

qm::Error plistError(ErrorCode code, std::string text) {
    return qm::Error{kErrorDomain, code, std::move(text)};
}

// A path like "/Plugins/3/name" that says where in a tree an error lies.
class TreePath {
public:
    void push(std::string component) { components_.push_back(std::move(component)); }
    void pop() { components_.pop_back(); }
    std::string text() const {
        if (components_.empty()) {
            return "/";
        }
        std::string out;
        for (const auto& component : components_) {
            out += '/';
            out += component;
        }
        return out;
    }
    std::size_t depth() const { return components_.size(); }

private:
    std::vector<std::string> components_;
};

// --- libplist to Value ------------------------------------------------------

// libplist 2.2's date getter truncates to 32-bit seconds and drops the sign of
// the fraction. The binary form of a lone date is exact: "bplist00", then the
// object, marker 0x33 and a big-endian IEEE 754 double of seconds since 2001.
std::optional<double> exactSecondsSince2001(plist_t date) {
    PlistPtr copy(plist_copy(date));
    if (!copy) {
        return std::nullopt;
    }
    char* raw = nullptr;
    std::uint32_t length = 0;
    plist_to_bin(copy.get(), &raw, &length);
    MallocPtr owner(raw);
    constexpr std::size_t kObject = 8;
    if (!raw || length < kObject + 9 || static_cast<std::uint8_t>(raw[kObject]) != 0x33) {
        return std::nullopt;
    }
    std::uint64_t bits = 0;
    for (std::size_t i = 1; i <= 8; ++i) {
        bits = (bits << 8) | static_cast<std::uint8_t>(raw[kObject + i]);
    }
    double seconds = 0;
    static_assert(sizeof seconds == sizeof bits);
    std::memcpy(&seconds, &bits, sizeof seconds);
    return seconds;
}

class PlistReader {
public:
    qm::Result<qm::Value> read(plist_t node) {
        if (!node) {
            return unsupported("missing node");
        }
        switch (plist_get_node_type(node)) {
            case PLIST_BOOLEAN: {
                std::uint8_t flag = 0;
                plist_get_bool_val(node, &flag);
                return qm::Value(flag != 0);
            }
            case PLIST_UINT: {
                std::uint64_t bits = 0;
                plist_get_uint_val(node, &bits);
                // Two's complement: this is how libplist holds negative numbers.
                return qm::Value(static_cast<std::int64_t>(bits));
            }
            case PLIST_REAL: {
                double real = 0;
                plist_get_real_val(node, &real);
                return qm::Value(real);
            }
            case PLIST_STRING: return readString(node);
            case PLIST_DATA: {
                std::uint64_t length = 0;
                const char* bytes = plist_get_data_ptr(node, &length);
                if (!bytes || length == 0) {
                    return qm::Value(qm::Bytes{});
                }
                auto* begin = reinterpret_cast<const std::uint8_t*>(bytes);
                return qm::Value(qm::Bytes(begin, begin + length));
            }
            case PLIST_DATE: {
                auto seconds = exactSecondsSince2001(node);
                if (!seconds || !std::isfinite(*seconds)) {
                    return malformed("unreadable date");
                }
                return qm::Value(qm::Date{*seconds + kSecondsFrom1970To2001});
            }
            case PLIST_ARRAY: return readArray(node);
            case PLIST_DICT: return readDictionary(node);
            case PLIST_UID: return unsupported("UID values are not supported");
            case PLIST_KEY:
            case PLIST_NONE: break;
        }
        return unsupported("unknown node type");
    }

private:
    qm::Error malformed(const std::string& what) const {
        return plistError(kErrorMalformed, "not a property list: " + what + " at " + path_.text());
    }
    qm::Error unsupported(const std::string& what) const {
        return plistError(kErrorUnsupported, what + " at " + path_.text());
    }

    qm::Result<qm::Value> readString(plist_t node) const {
        std::uint64_t length = 0;
        const char* text = plist_get_string_ptr(node, &length);
        if (!text) {
            return malformed("unreadable string");
        }
        std::size_t size = std::strlen(text);
        if (size != length) {
            return malformed("string with a NUL character");
        }
        std::string_view view(text, size);
        if (!qm::utf8::isValid(view)) {
            return malformed("string that is not UTF-8");
        }
        return qm::Value(std::string(view));
    }

    qm::MaybeError checkNesting() const {
        if (path_.depth() >= kMaxNesting) {
            return plistError(kErrorTooComplex, "property list nested too deeply at " + path_.text());
        }
        return std::nullopt;
    }

    qm::Result<qm::Value> readArray(plist_t node) {
        if (auto error = checkNesting()) {
            return *error;
        }
        plist_array_iter rawIterator = nullptr;
        plist_array_new_iter(node, &rawIterator);
        MallocPtr iterator(rawIterator);
        if (!iterator) {
            return malformed("unreadable array");
        }
        qm::Array array;
        for (;;) {
            plist_t item = nullptr;
            plist_array_next_item(node, rawIterator, &item);
            if (!item) {
                break;
            }
            path_.push(std::to_string(array.size()));
            auto value = read(item);
            path_.pop();
            if (!value) {
                return std::move(value).error();
            }
            array.push_back(std::move(value).value());
        }
        return qm::Value(std::move(array));
    }

    qm::Result<qm::Value> readDictionary(plist_t node) {
        if (auto error = checkNesting()) {
            return *error;
        }
        plist_dict_iter rawIterator = nullptr;
        plist_dict_new_iter(node, &rawIterator);
        MallocPtr iterator(rawIterator);
        if (!iterator) {
            return malformed("unreadable dictionary");
        }
        std::vector<qm::Dictionary::Entry> entries;
        for (;;) {
            char* rawKey = nullptr;
            plist_t item = nullptr;
            plist_dict_next_item(node, rawIterator, &rawKey, &item);
            MallocPtr keyOwner(rawKey);
            if (!item) {
                break;
            }
            if (!rawKey) {
                return malformed("dictionary entry without a key");
            }
            std::string key(rawKey);
            if (!qm::utf8::isValid(key)) {
                return malformed("key that is not UTF-8");
            }
            path_.push(key);
            auto value = read(item);
            path_.pop();
            if (!value) {
                return std::move(value).error();
            }
            entries.emplace_back(std::move(key), std::move(value).value());
        }
        auto dictionary = qm::Dictionary::fromEntries(std::move(entries));
        if (!dictionary) {
            return malformed("duplicate key in a dictionary");
        }
        return qm::Value(std::move(*dictionary));
    }

    TreePath path_;
};

// --- Value to libplist ------------------------------------------------------

class PlistWriter {
public:
    qm::Result<PlistPtr> write(const qm::Value& value) {
        switch (value.type()) {
            case qm::ValueType::boolean: return made(plist_new_bool(*value.asBool() ? 1 : 0));
            case qm::ValueType::signedInteger:
                // Two's complement: libplist's only integer type holds negatives this way.
                return made(plist_new_uint(static_cast<std::uint64_t>(*value.asSigned())));
            case qm::ValueType::unsignedInteger: {
                std::uint64_t number = *value.asUnsigned();
                if (number > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
                    return unsupported("unsigned integer above INT64_MAX (it would read back negative)");
                }
                return made(plist_new_uint(number));
            }
            case qm::ValueType::real: return made(plist_new_real(*value.asDouble()));
            case qm::ValueType::string: return writeString(*value.asString());
            case qm::ValueType::data: {
                const qm::Bytes& bytes = *value.asData();
                static const char kEmpty = 0;
                const char* begin = bytes.empty() ? &kEmpty : reinterpret_cast<const char*>(bytes.data());
                return made(plist_new_data(begin, bytes.size()));
            }
            case qm::ValueType::date: return writeDate(*value.asDate());
            case qm::ValueType::array: return writeArray(*value.asArray());
            case qm::ValueType::dictionary: return writeDictionary(*value.asDictionary());
            case qm::ValueType::null: return unsupported("null has no property-list form");
            case qm::ValueType::uuid: return unsupported("a UUID has no property-list form");
            case qm::ValueType::packed: return unsupported("a packed property list has no property-list form");
        }
        return unsupported("unknown value type");
    }

private:
    qm::Error unsupported(const std::string& what) const {
        return plistError(kErrorUnsupported, what + " at " + path_.text());
    }

    qm::Result<PlistPtr> made(plist_t node) const {
        if (!node) {
            return plistError(kErrorUnsupported, "libplist could not make a node at " + path_.text());
        }
        return PlistPtr(node);
    }

    // libplist takes C strings, so text must be free of NUL to survive.
    qm::MaybeError checkText(std::string_view text, const char* what) const {
        if (text.find('\0') != std::string_view::npos) {
            return unsupported(std::string(what) + " with a NUL character");
        }
        if (!qm::utf8::isValid(text)) {
            return unsupported(std::string(what) + " that is not UTF-8");
        }
        return std::nullopt;
    }

    qm::Result<PlistPtr> writeString(const std::string& text) const {
        if (auto error = checkText(text, "string")) {
            return *error;
        }
        return made(plist_new_string(text.c_str()));
    }

    qm::Result<PlistPtr> writeDate(qm::Date date) const {
        double sinceReference = date.secondsSince1970 - kSecondsFrom1970To2001;
        if (!std::isfinite(sinceReference)) {
            return unsupported("date that is not a finite number");
        }
        double whole = std::trunc(sinceReference);
        double micro = std::round((sinceReference - whole) * 1e6);
        if (std::fabs(micro) >= 1e6) {
            whole += micro > 0 ? 1 : -1;
            micro = 0;
        }
        if (whole < std::numeric_limits<std::int32_t>::min() || whole > std::numeric_limits<std::int32_t>::max()) {
            return unsupported("date outside 1932-12-13 to 2069-01-19");
        }
        // Seconds and microseconds share the sign, as libplist adds them.
        return made(plist_new_date(static_cast<std::int32_t>(whole), static_cast<std::int32_t>(micro)));
    }

    qm::MaybeError checkNesting() const {
        if (path_.depth() >= kMaxNesting) {
            return plistError(kErrorTooComplex, "value nested too deeply at " + path_.text());
        }
        return std::nullopt;
    }

    qm::Result<PlistPtr> writeArray(const qm::Array& array) {
        if (auto error = checkNesting()) {
            return *error;
        }
        auto created = made(plist_new_array());
        if (!created) {
            return created;
        }
        PlistPtr node = std::move(created).value();
        for (std::size_t i = 0; i < array.size(); ++i) {
            path_.push(std::to_string(i));
            auto item = write(array[i]);
            path_.pop();
            if (!item) {
                return std::move(item).error();
            }
            plist_array_append_item(node.get(), item->release());
        }
        return node;
    }

    qm::Result<PlistPtr> writeDictionary(const qm::Dictionary& dictionary) {
        if (auto error = checkNesting()) {
            return *error;
        }
        auto created = made(plist_new_dict());
        if (!created) {
            return created;
        }
        PlistPtr node = std::move(created).value();
        for (const auto& [key, value] : dictionary) {
            path_.push(key);
            qm::MaybeError keyError = checkText(key, "key");
            auto item = keyError ? qm::Result<PlistPtr>(*keyError) : write(value);
            path_.pop();
            if (!item) {
                return std::move(item).error();
            }
            plist_dict_set_item(node.get(), key.c_str(), item->release());
        }
        return node;
    }

    TreePath path_;
};

qm::Error withName(qm::Error error, const std::string& name) {
    error.description = name + ": " + error.text();
    return error;
}

qm::Error fileError(int code, const std::string& name, const char* what) {
    return qm::Error{kPosixErrorDomain, code, name + ": " + what};
}

std::string parentDirectory(const std::string& path) {
    auto slash = path.rfind('/');
    if (slash == std::string::npos) {
        return ".";
    }
    return slash == 0 ? "/" : path.substr(0, slash);
}

qm::MaybeError writeAll(int fd, const qm::Bytes& bytes) {
    std::size_t written = 0;
    while (written < bytes.size()) {
        ssize_t n = ::write(fd, bytes.data() + written, bytes.size() - written);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n <= 0) {
            return qm::posixError(n < 0 ? errno : EIO, "write");
        }
        written += static_cast<std::size_t>(n);
    }
    return std::nullopt;
}

}  // namespace

qm::Result<qm::Value> parse(std::span<const std::uint8_t> bytes) {
    if (bytes.empty()) {
        return plistError(kErrorMalformed, "not a property list: empty");
    }
    if (bytes.size() > kMaxBytes) {
        return plistError(kErrorTooComplex, "property list larger than 64 MiB");
    }
    const char* text = reinterpret_cast<const char*>(bytes.data());
    auto length = static_cast<std::uint32_t>(bytes.size());
    bool binary = plist_is_binary(text, length) != 0;
    qm::MaybeError unsafe = binary ? checkBinaryStructure(bytes, kMaxNesting, kMaxBinaryNodes)
                                   : checkXmlStructure(std::string_view(text, bytes.size()), kMaxNesting);
    if (unsafe) {
        return *unsafe;
    }
    plist_t raw = nullptr;
    if (binary) {
        plist_from_bin(text, length, &raw);
    } else {
        plist_from_xml(text, length, &raw);
    }
    PlistPtr root(raw);
    if (!root) {
        return plistError(kErrorMalformed, binary ? "not a property list: damaged binary property list"
                                                  : "not a property list: malformed XML");
    }
    return PlistReader().read(root.get());
}

qm::Result<qm::Value> readDescriptor(int fd, const std::string& name) {
    struct stat status {};
    if (::fstat(fd, &status) != 0) {
        return qm::posixError(errno, name);
    }
    if (S_ISDIR(status.st_mode)) {
        return qm::posixError(EISDIR, name);
    }
    if (!S_ISREG(status.st_mode)) {
        return fileError(EINVAL, name, "not a regular file");
    }
    if (status.st_size > static_cast<off_t>(kMaxBytes)) {
        return fileError(EFBIG, name, "larger than 64 MiB");
    }
    // Read to the end rather than trusting the size: the file may be growing.
    qm::Bytes bytes(static_cast<std::size_t>(status.st_size) + 1);
    std::size_t filled = 0;
    for (;;) {
        if (filled == bytes.size()) {
            if (bytes.size() > kMaxBytes) {
                return fileError(EFBIG, name, "larger than 64 MiB");
            }
            bytes.resize(std::min(bytes.size() * 2, kMaxBytes + 1));
        }
        ssize_t n = ::read(fd, bytes.data() + filled, bytes.size() - filled);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            return qm::posixError(errno, name);
        }
        if (n == 0) {
            break;
        }
        filled += static_cast<std::size_t>(n);
    }
    bytes.resize(filled);
    auto value = parse(bytes);
    if (!value) {
        return withName(std::move(value).error(), name);
    }
    return value;
}

qm::Result<qm::Value> readFile(const std::string& path) {
    // O_NONBLOCK: opening a FIFO must not wait for a writer; it is refused as
    // not a regular file right after.
    qm::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
    if (!fd) {
        return qm::posixError(errno, path);
    }
    return readDescriptor(fd.get(), path);
}

qm::Result<qm::Bytes> serialize(const qm::Value& value, Format format) {
    auto root = PlistWriter().write(value);
    if (!root) {
        return std::move(root).error();
    }
    char* raw = nullptr;
    std::uint32_t length = 0;
    switch (format) {
        case Format::xml: plist_to_xml(root->get(), &raw, &length); break;
        case Format::binary: plist_to_bin(root->get(), &raw, &length); break;
    }
    MallocPtr owner(raw);
    if (!raw) {
        return plistError(kErrorUnsupported, "libplist could not serialize the value");
    }
    auto* begin = reinterpret_cast<const std::uint8_t*>(raw);
    return qm::Bytes(begin, begin + length);
}

qm::MaybeError writeFileAtomically(const std::string& path, const qm::Value& value, Format format) {
    auto bytes = serialize(value, format);
    if (!bytes) {
        return withName(std::move(bytes).error(), path);
    }
    std::string directory = parentDirectory(path);
    std::string base = path.substr(path.rfind('/') == std::string::npos ? 0 : path.rfind('/') + 1);
    if (base.empty()) {
        return qm::posixError(EISDIR, path);
    }
    std::string temporary = directory + "/." + base + ".XXXXXX";
    qm::UniqueFd fd(::mkostemp(temporary.data(), O_CLOEXEC));
    if (!fd) {
        return qm::posixError(errno, "creating a temporary file for " + path);
    }
    auto fail = [&](int code, const std::string& what) {
        ::unlink(temporary.c_str());
        return qm::posixError(code, what + " " + path);
    };
    struct stat existing {};
    if (::stat(path.c_str(), &existing) == 0 && ::fchmod(fd.get(), existing.st_mode & 07777) != 0) {
        return fail(errno, "keeping the permissions of");
    }
    if (auto error = writeAll(fd.get(), *bytes)) {
        return fail(static_cast<int>(error->code), "writing");
    }
    if (::fsync(fd.get()) != 0) {
        return fail(errno, "flushing");
    }
    if (::close(fd.release()) != 0) {
        return fail(errno, "closing");
    }
    if (::rename(temporary.c_str(), path.c_str()) != 0) {
        return fail(errno, "renaming over");
    }
    // Makes the rename itself durable. The new content is in place whatever
    // this answers, so a failure here is not the write's failure.
    qm::UniqueFd directoryFd(::open(directory.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (directoryFd) {
        ::fsync(directoryFd.get());
    }
    return std::nullopt;
}

}  // namespace qm::plist
