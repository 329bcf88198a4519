#include "platform/plist/BinaryStructureCheck.h"

#include <algorithm>
#include <optional>
#include <string>
#include <vector>

#include "platform/plist/LibplistSupport.h"

namespace qm::plist {

namespace {

// The binary layout (all numbers big-endian): "bplist00", the objects, an
// offset table (one offset per object), and a 32-byte trailer: 6 unused
// bytes, the offset size, the reference size, the object count, the top
// object and the offset of the offset table. A container's marker is 0xAn
// (array), 0xCn (set) or 0xDn (dictionary, keys then values); n is its count,
// or 0xF followed by an integer object holding the count; then one reference
// per element.
class BinaryWalk {
public:
    BinaryWalk(std::span<const std::uint8_t> bytes, unsigned maxNesting, std::uint64_t maxNodes)
        : bytes_(bytes), maxNesting_(maxNesting), maxNodes_(maxNodes) {}

    qm::MaybeError run() {
        if (auto error = readTrailer()) {
            return error;
        }
        return walk();
    }

private:
    static constexpr std::size_t kHeaderSize = 8;
    static constexpr std::size_t kTrailerSize = 32;

    struct Container {
        std::uint64_t refs = 0;   // offset of the first reference
        std::uint64_t count = 0;  // number of references
        bool dictionary = false;  // the first half of the references are keys
    };

    enum class State : std::uint8_t { unseen, open, done };

    struct Frame {
        std::uint64_t object;
        Container container;
        std::uint64_t next = 0;     // next reference to follow
        std::uint32_t height = 0;   // deepest container nesting below, so far
        std::uint64_t nodes = 1;    // expanded nodes so far, itself included
    };

    std::uint64_t readNumber(std::uint64_t offset, unsigned size) const {
        std::uint64_t value = 0;
        for (unsigned i = 0; i < size; ++i) {
            value = (value << 8) | bytes_[offset + i];
        }
        return value;
    }

    qm::MaybeError readTrailer() {
        if (bytes_.size() < kHeaderSize + 2 + kTrailerSize) {
            return malformed("binary property list too short");
        }
        std::uint64_t trailer = bytes_.size() - kTrailerSize;
        offsetSize_ = bytes_[trailer + 6];
        refSize_ = bytes_[trailer + 7];
        objectCount_ = readNumber(trailer + 8, 8);
        topObject_ = readNumber(trailer + 16, 8);
        offsetTable_ = readNumber(trailer + 24, 8);
        if (offsetSize_ < 1 || offsetSize_ > 8 || refSize_ < 1 || refSize_ > 8) {
            return malformed("bad binary trailer");
        }
        if (objectCount_ == 0 || topObject_ >= objectCount_ || offsetTable_ < kHeaderSize + 1 ||
            offsetTable_ > trailer || objectCount_ > (trailer - offsetTable_) / offsetSize_) {
            return malformed("bad binary trailer");
        }
        if (objectCount_ > maxNodes_) {
            return plistError(kErrorTooComplex, "binary property list has too many objects");
        }
        return std::nullopt;
    }

    // Where object's bytes begin; nothing when its offset lies outside the objects.
    std::optional<std::uint64_t> objectOffset(std::uint64_t object) const {
        std::uint64_t offset = readNumber(offsetTable_ + object * offsetSize_, offsetSize_);
        if (offset < kHeaderSize || offset >= offsetTable_) {
            return std::nullopt;
        }
        return offset;
    }

    // The references of a container object; nothing for other objects.
    qm::Result<std::optional<Container>> containerOf(std::uint64_t object) const {
        auto offset = objectOffset(object);
        if (!offset) {
            return malformed("object offset out of range");
        }
        std::uint8_t marker = bytes_[*offset];
        unsigned kind = marker >> 4;
        if (kind != 0xA && kind != 0xC && kind != 0xD) {
            return std::optional<Container>();
        }
        std::uint64_t position = *offset + 1;
        std::uint64_t count = marker & 0x0F;
        if (count == 0x0F) {
            if (position >= offsetTable_ || (bytes_[position] >> 4) != 0x1 || (bytes_[position] & 0x0F) > 3) {
                return malformed("bad container count");
            }
            unsigned size = 1u << (bytes_[position] & 0x0F);
            if (offsetTable_ - position - 1 < size) {
                return malformed("bad container count");
            }
            count = readNumber(position + 1, size);
            position += 1 + size;
        }
        std::uint64_t available = (offsetTable_ - position) / refSize_;
        if (kind == 0xD) {
            if (count > available / 2) {
                return malformed("container runs past the objects");
            }
            count *= 2;
        } else if (count > available) {
            return malformed("container runs past the objects");
        }
        return std::optional<Container>(Container{position, count, kind == 0xD});
    }

    // A dictionary key must be a string without NUL: libplist 2.2 asserts
    // (and so aborts) when it hands out a key whose length disagrees with
    // strlen.
    qm::MaybeError checkKey(std::uint64_t object) const {
        auto offset = objectOffset(object);
        if (!offset) {
            return malformed("object offset out of range");
        }
        std::uint8_t marker = bytes_[*offset];
        unsigned kind = marker >> 4;
        if (kind != 0x5 && kind != 0x6) {
            return malformed("dictionary key that is not a string");
        }
        std::uint64_t position = *offset + 1;
        std::uint64_t count = marker & 0x0F;
        if (count == 0x0F) {
            if (position >= offsetTable_ || (bytes_[position] >> 4) != 0x1 || (bytes_[position] & 0x0F) > 3) {
                return malformed("bad string length");
            }
            unsigned size = 1u << (bytes_[position] & 0x0F);
            if (offsetTable_ - position - 1 < size) {
                return malformed("bad string length");
            }
            count = readNumber(position + 1, size);
            position += 1 + size;
        }
        unsigned unit = kind == 0x6 ? 2 : 1;
        if (count > (offsetTable_ - position) / unit) {
            return malformed("string runs past the objects");
        }
        for (std::uint64_t i = 0; i < count; ++i) {
            if (readNumber(position + i * unit, unit) == 0) {
                return malformed("dictionary key with a NUL character");
            }
        }
        return std::nullopt;
    }

    qm::MaybeError walk() {
        std::vector<State> state(objectCount_, State::unseen);
        std::vector<std::uint32_t> height(objectCount_, 0);
        std::vector<std::uint64_t> nodes(objectCount_, 1);
        std::vector<bool> keyChecked(objectCount_, false);
        std::vector<Frame> stack;

        auto top = containerOf(topObject_);
        if (!top) {
            return top.error();
        }
        if (!*top) {
            return std::nullopt;
        }
        stack.push_back(Frame{topObject_, **top});
        state[topObject_] = State::open;
        while (!stack.empty()) {
            Frame& frame = stack.back();
            if (frame.next == frame.container.count) {
                Frame finished = frame;
                stack.pop_back();
                state[finished.object] = State::done;
                height[finished.object] = finished.height + 1;
                nodes[finished.object] = finished.nodes;
                if (height[finished.object] > maxNesting_) {
                    return tooDeep(maxNesting_);
                }
                if (!stack.empty()) {
                    if (auto error = addChild(stack.back(), finished.object, height, nodes)) {
                        return error;
                    }
                }
                continue;
            }
            std::uint64_t child = readNumber(frame.container.refs + frame.next * refSize_, refSize_);
            ++frame.next;
            if (child >= objectCount_) {
                return malformed("reference to a missing object");
            }
            if (frame.container.dictionary && frame.next <= frame.container.count / 2 && !keyChecked[child]) {
                if (auto error = checkKey(child)) {
                    return error;
                }
                keyChecked[child] = true;
            }
            if (state[child] == State::open) {
                return malformed("object refers to itself");
            }
            if (state[child] == State::unseen) {
                auto container = containerOf(child);
                if (!container) {
                    return container.error();
                }
                if (*container) {
                    if (stack.size() >= maxNesting_) {
                        return tooDeep(maxNesting_);
                    }
                    state[child] = State::open;
                    stack.push_back(Frame{child, **container});
                    continue;
                }
                state[child] = State::done;
            }
            if (auto error = addChild(frame, child, height, nodes)) {
                return error;
            }
        }
        return std::nullopt;
    }

    qm::MaybeError addChild(Frame& parent, std::uint64_t child, const std::vector<std::uint32_t>& height,
                            const std::vector<std::uint64_t>& nodes) const {
        parent.height = std::max(parent.height, height[child]);
        parent.nodes += nodes[child];  // both at most maxNodes, so no overflow
        if (parent.nodes > maxNodes_) {
            return plistError(kErrorTooComplex,
                              "binary property list expands to more than " + std::to_string(maxNodes_) + " nodes");
        }
        return std::nullopt;
    }

    std::span<const std::uint8_t> bytes_;
    unsigned maxNesting_;
    std::uint64_t maxNodes_;
    unsigned offsetSize_ = 0;
    unsigned refSize_ = 0;
    std::uint64_t objectCount_ = 0;
    std::uint64_t topObject_ = 0;
    std::uint64_t offsetTable_ = 0;
};

}  // namespace

qm::MaybeError checkBinaryStructure(std::span<const std::uint8_t> bytes, unsigned maxNesting,
                                    std::uint64_t maxNodes) {
    return BinaryWalk(bytes, maxNesting, maxNodes).run();
}

}  // namespace qm::plist
