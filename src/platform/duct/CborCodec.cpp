#include "platform/duct/CborCodec.h"

#include <cbor.h>

#include <algorithm>
#include <bit>
#include <cassert>
#include <cmath>
#include <cstdio>
#include <cstring>
#include <limits>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/value/Utf8.h"

namespace qm::cbor {

namespace {

constexpr const char* kErrorDomain = "cbor";

Error cborError(std::string reason) {
    return Error{kErrorDomain, 0, std::move(reason)};
}

// ---------------------------------------------------------------------------
// Decoding

// What one call of libcbor's streaming decoder reported: one head, with the
// whole content for strings.
struct Event {
    enum class Kind : std::uint8_t {
        none,
        unsignedInteger,
        negativeInteger,  // number holds n of the value -1-n
        byteString,
        textString,
        array,  // number holds the count of items
        map,    // number holds the count of pairs
        tag,    // number holds the tag
        real,
        boolean,
        null,
        undefined,
        indefinite,
        breakCode,
    };
    Kind kind = Kind::none;
    bool flag = false;
    std::uint64_t number = 0;
    double real = 0;
    const std::uint8_t* bytes = nullptr;
    std::size_t size = 0;
};

Event& eventOf(void* context) {
    return *static_cast<Event*>(context);
}

template <class T>
void onUnsigned(void* context, T value) {
    Event& event = eventOf(context);
    event.kind = Event::Kind::unsignedInteger;
    event.number = value;
}

template <class T>
void onNegative(void* context, T value) {
    Event& event = eventOf(context);
    event.kind = Event::Kind::negativeInteger;
    event.number = value;
}

template <Event::Kind kind>
void onString(void* context, cbor_data data, std::size_t size) {
    Event& event = eventOf(context);
    event.kind = kind;
    event.bytes = data;
    event.size = size;
}

template <Event::Kind kind>
void onCount(void* context, std::size_t count) {
    Event& event = eventOf(context);
    event.kind = kind;
    event.number = count;
}

template <Event::Kind kind>
void onBare(void* context) {
    eventOf(context).kind = kind;
}

void onTag(void* context, std::uint64_t tag) {
    Event& event = eventOf(context);
    event.kind = Event::Kind::tag;
    event.number = tag;
}

void onFloat(void* context, float value) {
    Event& event = eventOf(context);
    event.kind = Event::Kind::real;
    event.real = value;
}

void onDouble(void* context, double value) {
    Event& event = eventOf(context);
    event.kind = Event::Kind::real;
    event.real = value;
}

void onBoolean(void* context, bool value) {
    Event& event = eventOf(context);
    event.kind = Event::Kind::boolean;
    event.flag = value;
}

const cbor_callbacks kEventCallbacks = {
    .uint8 = onUnsigned<std::uint8_t>,
    .uint16 = onUnsigned<std::uint16_t>,
    .uint32 = onUnsigned<std::uint32_t>,
    .uint64 = onUnsigned<std::uint64_t>,
    .negint64 = onNegative<std::uint64_t>,
    .negint32 = onNegative<std::uint32_t>,
    .negint16 = onNegative<std::uint16_t>,
    .negint8 = onNegative<std::uint8_t>,
    .byte_string_start = onBare<Event::Kind::indefinite>,
    .byte_string = onString<Event::Kind::byteString>,
    .string = onString<Event::Kind::textString>,
    .string_start = onBare<Event::Kind::indefinite>,
    .indef_array_start = onBare<Event::Kind::indefinite>,
    .array_start = onCount<Event::Kind::array>,
    .indef_map_start = onBare<Event::Kind::indefinite>,
    .map_start = onCount<Event::Kind::map>,
    .tag = onTag,
    .float2 = onFloat,
    .float4 = onFloat,
    .float8 = onDouble,
    .undefined = onBare<Event::Kind::undefined>,
    .null = onBare<Event::Kind::null>,
    .boolean = onBoolean,
    .indef_break = onBare<Event::Kind::breakCode>,
};

constexpr std::uint64_t kDateTag = 1;
constexpr std::uint64_t kPackedTag = 24;
constexpr std::uint64_t kUuidTag = 37;

// What a decoded tree allocates, as Value lays it out: each non-empty string,
// data, array, dictionary and packed value is one shared block (the control
// block beside the object), plus the heap storage of its contents. Empty ones
// share one object and scalars live in their slot: they cost nothing more.
constexpr std::size_t kSharedBlockOverhead = 2 * sizeof(void*);

std::size_t stringStorage(std::size_t size) {
    static const std::size_t inlineCapacity = std::string().capacity();
    return size > inlineCapacity ? size + 1 : 0;
}

std::size_t textCost(std::size_t size) {
    return size == 0 ? 0 : kSharedBlockOverhead + sizeof(std::string) + stringStorage(size);
}

std::size_t dataCost(std::size_t size) {
    return size == 0 ? 0 : kSharedBlockOverhead + sizeof(Bytes) + size;
}

std::size_t arrayCost(std::uint64_t count) {
    return count == 0 ? 0 : kSharedBlockOverhead + sizeof(Array) + count * sizeof(Value);
}

std::size_t mapCost(std::uint64_t count) {
    return count == 0 ? 0 : kSharedBlockOverhead + sizeof(Dictionary) + count * sizeof(Dictionary::Entry);
}

constexpr std::size_t kPackedCost = kSharedBlockOverhead + sizeof(Value);

// libcbor reports only "error" for heads it refuses; name the reason from the
// initial byte.
std::string describeRefusedHead(std::uint8_t initial) {
    unsigned major = initial >> 5;
    unsigned additional = initial & 0x1Fu;
    char buffer[64];
    if (additional >= 28 && additional <= 30) {
        std::snprintf(buffer, sizeof buffer, "reserved initial byte 0x%02x", initial);
    } else if (major == 6) {
        std::snprintf(buffer, sizeof buffer, "unsupported tag %u", additional);
    } else if (major == 7) {
        std::snprintf(buffer, sizeof buffer, "unsupported simple value (initial byte 0x%02x)", initial);
    } else {
        std::snprintf(buffer, sizeof buffer, "malformed item (initial byte 0x%02x)", initial);
    }
    return buffer;
}

// A key for an error message: printable, and short enough for one log line.
std::string quotedKey(std::string_view key) {
    constexpr std::size_t kMaxShown = 64;
    std::string shown;
    std::size_t position = 0;
    while (position < key.size() && shown.size() < kMaxShown) {
        auto c = static_cast<unsigned char>(key[position]);
        std::size_t length = c < 0x80 ? 1 : utf8::sequenceLength(key.substr(position));
        if (length == 0) {
            length = 1;  // keys are validated before this; stay safe anyway
        }
        if (c < 0x20 || c == 0x7F || c == '"' || c == '\\') {
            shown += '?';
        } else {
            shown.append(key.substr(position, length));
        }
        position += length;
    }
    if (position < key.size()) {
        shown += "...";
    }
    return "\"" + shown + "\"";
}

std::optional<std::int64_t> negativeValue(std::uint64_t n) {
    if (n > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
        return std::nullopt;
    }
    return -1 - static_cast<std::int64_t>(n);
}

// Builds a dictionary from the entries of one map, naming a duplicate key.
Result<Dictionary> dictionaryFromEntries(std::vector<Dictionary::Entry> entries) {
    auto notAscending = [](const Dictionary::Entry& a, const Dictionary::Entry& b) { return !(a.first < b.first); };
    // Our own encoder writes keys in order; only other input needs sorting to
    // find a duplicate.
    if (std::adjacent_find(entries.begin(), entries.end(), notAscending) != entries.end()) {
        std::sort(entries.begin(), entries.end(),
                  [](const Dictionary::Entry& a, const Dictionary::Entry& b) { return a.first < b.first; });
        auto duplicate = std::adjacent_find(entries.begin(), entries.end(),
                                            [](const Dictionary::Entry& a, const Dictionary::Entry& b) {
                                                return a.first == b.first;
                                            });
        if (duplicate != entries.end()) {
            return cborError("duplicate map key " + quotedKey(duplicate->first));
        }
    }
    auto dictionary = Dictionary::fromEntries(std::move(entries));
    assert(dictionary);
    return std::move(*dictionary);
}

enum class FrameKind : std::uint8_t { array, map, dateTag, packedTag, uuidTag };

struct Frame {
    FrameKind kind;
    std::size_t expected = 0;  // items of an array, pairs of a map
    Array items;
    // A map's key is placed with a null value until its value arrives.
    std::vector<Dictionary::Entry> entries;
    bool hasKey = false;
};

// A stretch of bytes that must hold exactly one item: the payload, or the
// content of a tag 24. Its item is complete when the frame stack is back
// to baseDepth.
struct Segment {
    const std::uint8_t* data;
    std::size_t size;
    std::size_t position;
    std::size_t baseDepth;
};

// The decoder's two stacks, kept per thread so that a request costs no
// allocation for them; emptied before and after every use.
struct DecoderStacks {
    std::vector<Segment> segments;
    std::vector<Frame> frames;
    bool inUse = false;
};
thread_local DecoderStacks threadStacks;

// Decodes one payload head by head. Containers and tags under construction
// sit on frames_; the content of each tag 24 is decoded as a nested segment of
// the same payload, so neither nesting nor packed content recurses.
class StreamDecoder {
public:
    explicit StreamDecoder(std::span<const std::uint8_t> payload)
        : payload_(payload),
          stacks_(threadStacks.inUse ? ownStacks_ : threadStacks),
          segments_(stacks_.segments),
          frames_(stacks_.frames),
          allowance_(decodedSizeBound(payload.size())) {
        stacks_.inUse = true;
    }
    ~StreamDecoder() {
        segments_.clear();
        frames_.clear();
        stacks_.inUse = false;
    }
    StreamDecoder(const StreamDecoder&) = delete;
    StreamDecoder& operator=(const StreamDecoder&) = delete;

    Result<Value> run();
    std::size_t allocatedBytes() const { return allocated_; }

private:
    MaybeError handle(const Event& event, std::size_t bytesLeft);
    MaybeError takeKey(Frame& map, const Event& event);
    MaybeError finishDate(const Event& event);
    MaybeError finishUuid(const Event& event);
    MaybeError enterPacked(const Event& event);
    MaybeError openContainer(FrameKind kind, std::uint64_t count, std::size_t bytesLeft);
    MaybeError openTag(std::uint64_t tag);
    MaybeError checkDepth() const;
    // Counts bytes the tree is about to allocate; an error once past the allowance.
    MaybeError charge(std::size_t bytes);
    // Whether the packed tag on top of the stack has had its byte string, so
    // that heads now belong to the item inside it.
    bool isPackedContentOpen() const { return segments_.back().baseDepth == frames_.size(); }
    MaybeError deliver(Value value);

    std::span<const std::uint8_t> payload_;
    DecoderStacks ownStacks_;  // only when the thread's are taken (never, today)
    DecoderStacks& stacks_;
    std::vector<Segment>& segments_;
    std::vector<Frame>& frames_;
    std::optional<Value> root_;
    const std::size_t allowance_;
    std::size_t allocated_ = 0;
};

Result<Value> StreamDecoder::run() {
    if (payload_.empty()) {
        return cborError("empty payload");
    }
    segments_.push_back(Segment{payload_.data(), payload_.size(), 0, 0});
    frames_.reserve(8);
    while (!root_) {
        Segment& segment = segments_.back();
        if (segment.position == segment.size) {
            return cborError("truncated item");
        }
        const std::uint8_t* head = segment.data + segment.position;
        std::size_t available = segment.size - segment.position;
        Event event;
        cbor_decoder_result result = cbor_stream_decode(head, available, &kEventCallbacks, &event);
        if (result.status == CBOR_DECODER_NEDATA) {
            return cborError("truncated item");
        }
        if (result.status != CBOR_DECODER_FINISHED || event.kind == Event::Kind::none) {
            return cborError(describeRefusedHead(*head));
        }
        segment.position += result.read;
        if (auto error = handle(event, available - result.read)) {
            return std::move(*error);
        }
    }
    if (segments_.front().position != payload_.size()) {
        return cborError("trailing bytes");
    }
    return std::move(*root_);
}

MaybeError StreamDecoder::handle(const Event& event, std::size_t bytesLeft) {
    switch (event.kind) {
        case Event::Kind::indefinite: return cborError("indefinite length");
        case Event::Kind::breakCode: return cborError("unexpected break");
        case Event::Kind::undefined: return cborError("undefined is not supported");
        default: break;
    }
    if (!frames_.empty()) {
        Frame& top = frames_.back();
        switch (top.kind) {
            case FrameKind::map:
                if (!top.hasKey) {
                    return takeKey(top, event);
                }
                break;
            case FrameKind::dateTag: return finishDate(event);
            case FrameKind::uuidTag: return finishUuid(event);
            case FrameKind::packedTag:
                if (!isPackedContentOpen()) {
                    return enterPacked(event);
                }
                break;
            case FrameKind::array: break;
        }
    }
    switch (event.kind) {
        case Event::Kind::unsignedInteger: return deliver(Value(event.number));
        case Event::Kind::negativeInteger: {
            auto value = negativeValue(event.number);
            if (!value) {
                return cborError("negative integer below -2^63");
            }
            return deliver(Value(*value));
        }
        case Event::Kind::real: return deliver(Value(event.real));
        case Event::Kind::boolean: return deliver(Value(event.flag));
        case Event::Kind::null: return deliver(Value());
        case Event::Kind::textString: {
            std::string_view text(reinterpret_cast<const char*>(event.bytes), event.size);
            if (!utf8::isValid(text)) {
                return cborError("text is not UTF-8");
            }
            if (auto error = charge(textCost(text.size()))) {
                return error;
            }
            return deliver(Value(std::string(text)));
        }
        case Event::Kind::byteString:
            if (auto error = charge(dataCost(event.size))) {
                return error;
            }
            return deliver(Value(Bytes(event.bytes, event.bytes + event.size)));
        case Event::Kind::array: return openContainer(FrameKind::array, event.number, bytesLeft);
        case Event::Kind::map: return openContainer(FrameKind::map, event.number, bytesLeft);
        case Event::Kind::tag: return openTag(event.number);
        case Event::Kind::none:
        case Event::Kind::undefined:
        case Event::Kind::indefinite:
        case Event::Kind::breakCode: break;
    }
    assert(false && "event kinds are handled above");
    return cborError("malformed item");
}

MaybeError StreamDecoder::takeKey(Frame& map, const Event& event) {
    if (event.kind != Event::Kind::textString) {
        return cborError("map key is not text");
    }
    std::string_view key(reinterpret_cast<const char*>(event.bytes), event.size);
    if (!utf8::isValid(key)) {
        return cborError("text is not UTF-8");
    }
    if (auto error = charge(stringStorage(key.size()))) {
        return error;
    }
    map.entries.emplace_back(std::string(key), Value());
    map.hasKey = true;
    return std::nullopt;
}

MaybeError StreamDecoder::finishDate(const Event& event) {
    double seconds;
    switch (event.kind) {
        case Event::Kind::unsignedInteger: seconds = static_cast<double>(event.number); break;
        case Event::Kind::negativeInteger: {
            auto value = negativeValue(event.number);
            if (!value) {
                return cborError("negative integer below -2^63");
            }
            seconds = static_cast<double>(*value);
            break;
        }
        case Event::Kind::real:
            if (!std::isfinite(event.real)) {
                return cborError("tag 1 content is not a finite number");
            }
            seconds = event.real;
            break;
        default: return cborError("tag 1 content is not a number");
    }
    frames_.pop_back();
    return deliver(Value(Date{seconds}));
}

MaybeError StreamDecoder::finishUuid(const Event& event) {
    if (event.kind != Event::Kind::byteString || event.size != 16) {
        return cborError("tag 37 content is not a 16-byte byte string");
    }
    frames_.pop_back();
    return deliver(Value(Uuid::fromBytes(event.bytes)));
}

MaybeError StreamDecoder::enterPacked(const Event& event) {
    if (event.kind != Event::Kind::byteString) {
        return cborError("tag 24 content is not a byte string");
    }
    // The packed tag's frame stays open below the content, so the content's
    // levels count on from it.
    segments_.push_back(Segment{event.bytes, event.size, 0, frames_.size()});
    return std::nullopt;
}

MaybeError StreamDecoder::charge(std::size_t bytes) {
    allocated_ += bytes;
    if (allocated_ > allowance_) {
        return cborError("decoded size would pass " + std::to_string(allowance_) + " bytes, " +
                         std::to_string(kMaxDecodedBytesPerByte) + " times the payload's");
    }
    return std::nullopt;
}

MaybeError StreamDecoder::checkDepth() const {
    if (frames_.size() + 1 > kMaxNestingDepth) {
        return cborError("nesting deeper than " + std::to_string(kMaxNestingDepth) + " levels");
    }
    return std::nullopt;
}

MaybeError StreamDecoder::openContainer(FrameKind kind, std::uint64_t count, std::size_t bytesLeft) {
    if (auto error = checkDepth()) {
        return error;
    }
    // Every item takes at least one byte, so a count the rest of the segment
    // cannot hold is truncation, found before anything is allocated for it.
    std::uint64_t itemsPerEntry = kind == FrameKind::map ? 2 : 1;
    if (count > bytesLeft / itemsPerEntry) {
        return cborError("truncated item");
    }
    if (count == 0) {
        return kind == FrameKind::map ? deliver(Value(Dictionary())) : deliver(Value(Array()));
    }
    // The whole container is charged before anything is allocated for it;
    // once within the allowance, its count is safe to reserve at once.
    if (auto error = charge(kind == FrameKind::map ? mapCost(count) : arrayCost(count))) {
        return error;
    }
    Frame& frame = frames_.emplace_back(Frame{kind, count, {}, {}, false});
    if (kind == FrameKind::map) {
        frame.entries.reserve(count);
    } else {
        frame.items.reserve(count);
    }
    return std::nullopt;
}

MaybeError StreamDecoder::openTag(std::uint64_t tag) {
    FrameKind kind;
    switch (tag) {
        case kDateTag: kind = FrameKind::dateTag; break;
        case kPackedTag: kind = FrameKind::packedTag; break;
        case kUuidTag: kind = FrameKind::uuidTag; break;
        default: return cborError("unsupported tag " + std::to_string(tag));
    }
    if (auto error = checkDepth()) {
        return error;
    }
    if (kind == FrameKind::packedTag) {
        if (auto error = charge(kPackedCost)) {
            return error;
        }
    }
    frames_.push_back(Frame{kind, 0, {}, {}, false});
    return std::nullopt;
}

// Hands a finished item to whatever holds it, closing every container that it
// completes on the way up.
MaybeError StreamDecoder::deliver(Value value) {
    while (true) {
        Segment& segment = segments_.back();
        if (frames_.size() == segment.baseDepth) {
            if (segments_.size() == 1) {
                root_ = std::move(value);
                return std::nullopt;
            }
            if (segment.position != segment.size) {
                return cborError("trailing bytes in tag 24 content");
            }
            segments_.pop_back();
            assert(!frames_.empty() && frames_.back().kind == FrameKind::packedTag);
            frames_.pop_back();
            value = Value::packed(std::move(value));
            continue;
        }
        Frame& top = frames_.back();
        if (top.kind == FrameKind::array) {
            top.items.push_back(std::move(value));
            if (top.items.size() < top.expected) {
                return std::nullopt;
            }
            value = Value(std::move(top.items));
            frames_.pop_back();
            continue;
        }
        assert(top.kind == FrameKind::map && top.hasKey);
        top.entries.back().second = std::move(value);
        top.hasKey = false;
        if (top.entries.size() < top.expected) {
            return std::nullopt;
        }
        auto dictionary = dictionaryFromEntries(std::move(top.entries));
        if (!dictionary) {
            return std::move(dictionary).error();
        }
        value = Value(std::move(dictionary).value());
        frames_.pop_back();
    }
}

// ---------------------------------------------------------------------------
// Encoding

enum MajorType : std::uint8_t {
    kUnsigned = 0,
    kNegative = 1,
    kByteString = 2,
    kTextString = 3,
    kArray = 4,
    kMap = 5,
    kTag = 6,
};

constexpr std::uint8_t kFalse = 0xF4;
constexpr std::uint8_t kTrue = 0xF5;
constexpr std::uint8_t kNull = 0xF6;
constexpr std::uint8_t kDouble = 0xFB;
constexpr std::size_t kMaxHeadSize = 9;
constexpr std::size_t kInitialOutputRoom = 256;

// Writes the head of an item, the argument in its shortest form, at to;
// returns its size.
std::size_t makeHead(std::uint8_t* to, MajorType major, std::uint64_t argument) {
    auto initial = static_cast<std::uint8_t>(major << 5);
    if (argument < 24) {
        to[0] = static_cast<std::uint8_t>(initial | argument);
        return 1;
    }
    std::size_t width;
    if (argument <= 0xFF) {
        to[0] = initial | 24;
        width = 1;
    } else if (argument <= 0xFFFF) {
        to[0] = initial | 25;
        width = 2;
    } else if (argument <= 0xFFFFFFFF) {
        to[0] = initial | 26;
        width = 4;
    } else {
        to[0] = initial | 27;
        width = 8;
    }
    for (std::size_t i = 0; i < width; ++i) {
        to[width - i] = static_cast<std::uint8_t>(argument >> (8 * i));
    }
    return 1 + width;
}

// Walks a value with an explicit stack of open containers, so even a value
// built deeper than any decoder would accept cannot exhaust the call stack.
// Bytes go straight into out's storage, which grows geometrically and is cut
// to size at the end: per-item vector appends cost more than the encoding.
class StreamEncoder {
public:
    explicit StreamEncoder(Bytes& out) : out_(out), used_(out.size()) {}

    void run(const Value& root) {
        writeItem(root);
        while (!open_.empty()) {
            OpenItem& item = open_.back();
            switch (item.kind) {
                case OpenItem::Kind::array:
                    if (item.nextItem == item.endItem) {
                        open_.pop_back();
                    } else {
                        writeItem(*item.nextItem++);  // may push: item is not used after
                    }
                    break;
                case OpenItem::Kind::dictionary:
                    if (item.nextEntry == item.endEntry) {
                        open_.pop_back();
                    } else {
                        const Dictionary::Entry& entry = *item.nextEntry++;
                        writeString(kTextString, entry.first.data(), entry.first.size());
                        writeItem(entry.second);
                    }
                    break;
                case OpenItem::Kind::packed: {
                    std::size_t start = item.packedStart;
                    open_.pop_back();
                    closePacked(start);
                    break;
                }
            }
        }
        out_.resize(used_);
    }

private:
    struct OpenItem {
        enum class Kind : std::uint8_t { array, dictionary, packed };
        Kind kind;
        Array::const_iterator nextItem{};
        Array::const_iterator endItem{};
        Dictionary::const_iterator nextEntry{};
        Dictionary::const_iterator endEntry{};
        std::size_t packedStart = 0;  // where the content's byte-string head goes
    };

    // Room for size more bytes at the end of what is written; valid until the
    // next claim.
    std::uint8_t* claim(std::size_t size) {
        if (out_.size() - used_ < size) {
            out_.resize(std::max({2 * out_.size(), used_ + size, kInitialOutputRoom}));
        }
        std::uint8_t* at = out_.data() + used_;
        used_ += size;
        return at;
    }

    void writeByte(std::uint8_t byte) { *claim(1) = byte; }

    void writeHead(MajorType major, std::uint64_t argument) {
        std::uint8_t head[kMaxHeadSize];
        std::size_t size = makeHead(head, major, argument);
        std::memcpy(claim(size), head, size);
    }

    void writeString(MajorType major, const void* data, std::size_t size) {
        std::uint8_t head[kMaxHeadSize];
        std::size_t headSize = makeHead(head, major, size);
        std::uint8_t* at = claim(headSize + size);
        std::memcpy(at, head, headSize);
        if (size != 0) {
            std::memcpy(at + headSize, data, size);
        }
    }

    void writeSigned(std::int64_t value) {
        if (value < 0) {
            writeHead(kNegative, static_cast<std::uint64_t>(-1 - value));
        } else {
            writeHead(kUnsigned, static_cast<std::uint64_t>(value));
        }
    }

    void writeDouble(double value) {
        std::uint8_t* at = claim(kMaxHeadSize);
        at[0] = kDouble;
        auto bits = std::bit_cast<std::uint64_t>(value);
        for (std::size_t i = 0; i < 8; ++i) {
            at[8 - i] = static_cast<std::uint8_t>(bits >> (8 * i));
        }
    }

    // Whole seconds within int64 travel as an integer, anything else as a double.
    void writeDate(Date date) {
        writeHead(kTag, kDateTag);
        double seconds = date.secondsSince1970;
        constexpr double kTwoToThe63 = 9223372036854775808.0;
        if (std::isfinite(seconds) && std::trunc(seconds) == seconds && seconds >= -kTwoToThe63 &&
            seconds < kTwoToThe63) {
            writeSigned(static_cast<std::int64_t>(seconds));
        } else {
            writeDouble(seconds);
        }
    }

    void writeItem(const Value& value) {
        switch (value.type()) {
            case ValueType::null: writeByte(kNull); return;
            case ValueType::boolean: writeByte(*value.asBool() ? kTrue : kFalse); return;
            case ValueType::unsignedInteger: writeHead(kUnsigned, *value.asUnsigned()); return;
            case ValueType::signedInteger: writeSigned(*value.asSigned()); return;
            case ValueType::real: writeDouble(*value.asDouble()); return;
            case ValueType::string: {
                const std::string& text = *value.asString();
                writeString(kTextString, text.data(), text.size());
                return;
            }
            case ValueType::data: {
                const Bytes& data = *value.asData();
                writeString(kByteString, data.data(), data.size());
                return;
            }
            case ValueType::date: writeDate(*value.asDate()); return;
            case ValueType::uuid:
                writeHead(kTag, kUuidTag);
                writeString(kByteString, value.asUuid()->bytes.data(), 16);
                return;
            case ValueType::array: {
                const Array& array = *value.asArray();
                writeHead(kArray, array.size());
                if (!array.empty()) {
                    open_.push_back(OpenItem{OpenItem::Kind::array, array.begin(), array.end(), {}, {}, 0});
                }
                return;
            }
            case ValueType::dictionary: {
                const Dictionary& dictionary = *value.asDictionary();
                writeHead(kMap, dictionary.size());
                if (!dictionary.empty()) {
                    open_.push_back(
                        OpenItem{OpenItem::Kind::dictionary, {}, {}, dictionary.begin(), dictionary.end(), 0});
                }
                return;
            }
            case ValueType::packed: {
                writeHead(kTag, kPackedTag);
                // The content's length is known only once it is written: leave
                // room for the longest head and close the gap afterwards.
                std::size_t start = used_;
                claim(kMaxHeadSize);
                open_.push_back(OpenItem{OpenItem::Kind::packed, {}, {}, {}, {}, start});
                writeItem(*value.packedContent());
                return;
            }
        }
    }

    void closePacked(std::size_t start) {
        std::size_t contentStart = start + kMaxHeadSize;
        std::size_t contentSize = used_ - contentStart;
        std::uint8_t head[kMaxHeadSize];
        std::size_t headSize = makeHead(head, kByteString, contentSize);
        if (headSize != kMaxHeadSize) {
            std::memmove(out_.data() + start + headSize, out_.data() + contentStart, contentSize);
            used_ = start + headSize + contentSize;
        }
        std::memcpy(out_.data() + start, head, headSize);
    }

    Bytes& out_;
    std::size_t used_;  // bytes of out_ written; the rest is room
    std::vector<OpenItem> open_;
};

}  // namespace

Result<Value> decode(std::span<const std::uint8_t> payload) {
    return StreamDecoder(payload).run();
}

Result<Decoded> decodeMeasured(std::span<const std::uint8_t> payload) {
    StreamDecoder decoder(payload);
    auto value = decoder.run();
    if (!value) {
        return std::move(value).error();
    }
    return Decoded{std::move(value).value(), decoder.allocatedBytes()};
}

void encode(const Value& value, Bytes& out) {
    StreamEncoder(out).run(value);
}

Bytes encode(const Value& value) {
    Bytes out;
    encode(value, out);
    return out;
}

}  // namespace qm::cbor
