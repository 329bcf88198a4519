#include "platform/plist/PropertyList.h"

#include <fcntl.h>
#include <plist/plist.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <string_view>

#include "platform/fd/UniqueFd.h"
#include "platform/file/PathFacts.h"
#include "platform/file/WriteAll.h"
#include "platform/plist/BinaryStructureCheck.h"
#include "platform/plist/LibplistSupport.h"
#include "platform/plist/PlistFromValue.h"
#include "platform/plist/ValueFromPlist.h"
#include "platform/plist/XmlStructureCheck.h"

namespace qm::plist {

namespace {

qm::Error withName(qm::Error error, const std::string& name) {
    error.description = name + ": " + error.text();
    return error;
}

qm::Error fileError(int code, const std::string& name, const char* what) {
    return qm::Error{kPosixErrorDomain, code, name + ": " + what};
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
    qm::MaybeError unsafe = binary ? checkBinaryStructure(bytes, kMaxNesting, binaryNodeBound(bytes.size()))
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
    return valueFromPlist(root.get());
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
    auto root = plistFromValue(value);
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
    std::string directory = qm::parentFolderOf(path);
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
    if (auto error = qm::writeAll(fd.get(), *bytes)) {
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
