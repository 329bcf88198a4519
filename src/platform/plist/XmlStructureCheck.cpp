#include "platform/plist/XmlStructureCheck.h"

#include <string>

#include "platform/plist/LibplistSupport.h"

namespace qm::plist {

namespace {

bool isXmlSpace(char c) {
    return c == ' ' || c == '\t' || c == '\r' || c == '\n';
}

bool isScalarTag(std::string_view name) {
    return name == "key" || name == "string" || name == "integer" || name == "real" || name == "true" ||
           name == "false" || name == "data" || name == "date";
}

bool isContainerTag(std::string_view name) {
    return name == "array" || name == "dict";
}

// Walks an XML document the way libplist's parser does, counting open
// containers. It accepts only where libplist stops reading too (the root is
// complete, or the text ends) and never counts fewer open containers than
// libplist holds; it may refuse a document that libplist would read, never
// the other way round.
class XmlWalk {
public:
    XmlWalk(std::string_view text, unsigned maxNesting) : text_(text), maxNesting_(maxNesting) {}

    qm::MaybeError run() {
        unsigned depth = 0;  // open containers, the root counted even when written empty
        bool haveRoot = false;
        bool rootWrittenEmpty = false;
        for (;;) {
            skipSpace();
            if (atEnd()) {
                return haveRoot ? qm::MaybeError() : malformed("no root element");
            }
            if (text_[pos_] != '<') {
                return malformed("text outside of an element");
            }
            ++pos_;
            if (atEnd()) {
                return malformed("unexpected end inside a tag");
            }
            if (text_[pos_] == '?') {
                if (auto error = skipPast("?>", true)) {
                    return error;
                }
                continue;
            }
            if (text_[pos_] == '!') {
                if (auto error = skipDeclarationOrComment()) {
                    return error;
                }
                continue;
            }
            std::string_view name;
            bool empty = false;
            if (auto error = readTag(name, empty)) {
                return error;
            }
            if (name == "plist" || name == "/plist") {
                continue;
            }
            if (isContainerTag(name)) {
                // An empty root stays the parent of what follows it in libplist,
                // so it counts as open.
                if (!haveRoot) {
                    haveRoot = true;
                    rootWrittenEmpty = empty;
                    depth = 1;
                    continue;
                }
                if (depth + 1 > maxNesting_) {
                    return tooDeep(maxNesting_);
                }
                if (!empty) {
                    ++depth;
                }
                continue;
            }
            if (name == "/array" || name == "/dict") {
                if (depth == 0 || (depth == 1 && rootWrittenEmpty)) {
                    return malformed("closing tag without an opening one");
                }
                if (--depth == 0) {
                    return std::nullopt;  // the root is complete; libplist reads no further
                }
                continue;
            }
            if (isScalarTag(name)) {
                if (!haveRoot) {
                    return std::nullopt;  // a scalar root is the whole document for libplist
                }
                if (!empty) {
                    if (auto error = skipScalarContent(name)) {
                        return error;
                    }
                }
                continue;
            }
            return malformed("unexpected tag <" + std::string(name) + ">");
        }
    }

private:
    bool atEnd() const { return pos_ >= text_.size(); }

    bool startsWith(std::string_view s) const { return text_.substr(pos_).starts_with(s); }

    void skipSpace() {
        while (!atEnd() && isXmlSpace(text_[pos_])) {
            ++pos_;
        }
    }

    // At a '"': moves past the closing quote. Quoted text holding '<' or '>'
    // is refused: parsers that do and do not honour quotes would end the tag
    // in different places.
    qm::MaybeError skipQuoted() {
        std::size_t close = text_.find('"', pos_ + 1);
        if (close == std::string_view::npos) {
            return malformed("unterminated quoted text");
        }
        std::string_view quoted = text_.substr(pos_ + 1, close - pos_ - 1);
        if (quoted.find_first_of("<>") != std::string_view::npos) {
            return malformed("markup characters in quoted text");
        }
        pos_ = close + 1;
        return std::nullopt;
    }

    // Moves to the first of stops, skipping quoted text; an error at the end.
    qm::MaybeError findAnyOutsideQuotes(std::string_view stops) {
        while (!atEnd()) {
            if (text_[pos_] == '"') {
                if (auto error = skipQuoted()) {
                    return error;
                }
                continue;
            }
            if (stops.find(text_[pos_]) != std::string_view::npos) {
                return std::nullopt;
            }
            ++pos_;
        }
        return malformed("unexpected end inside a tag");
    }

    // Moves just past the next terminator, optionally skipping quoted text.
    qm::MaybeError skipPast(std::string_view terminator, bool honourQuotes) {
        while (!atEnd()) {
            if (startsWith(terminator)) {
                pos_ += terminator.size();
                return std::nullopt;
            }
            if (honourQuotes && text_[pos_] == '"') {
                if (auto error = skipQuoted()) {
                    return error;
                }
                continue;
            }
            ++pos_;
        }
        return malformed("missing \"" + std::string(terminator) + "\"");
    }

    // At the '!' of "<!": a comment or the DOCTYPE line.
    qm::MaybeError skipDeclarationOrComment() {
        if (startsWith("!--")) {
            pos_ += 3;
            return skipPast("-->", false);
        }
        if (startsWith("!DOCTYPE")) {
            pos_ += 8;
            if (auto error = findAnyOutsideQuotes("[>")) {
                return error;
            }
            if (text_[pos_] == '[') {
                return malformed("internal DTD subsets are not supported");
            }
            ++pos_;
            return std::nullopt;
        }
        return malformed("unexpected markup declaration");
    }

    // After '<': the tag's name (with a leading '/' for a closing tag) and
    // whether it ends in "/>". Leaves the position past the '>'.
    qm::MaybeError readTag(std::string_view& name, bool& empty) {
        std::size_t start = pos_;
        while (!atEnd() && std::string_view(" \r\n\t<>").find(text_[pos_]) == std::string_view::npos) {
            ++pos_;
        }
        if (atEnd()) {
            return malformed("unexpected end inside a tag");
        }
        name = text_.substr(start, pos_ - start);
        if (text_[pos_] != '>') {
            if (auto error = findAnyOutsideQuotes("<>")) {
                return error;
            }
            if (text_[pos_] != '>') {
                return malformed("missing '>' in a tag");
            }
        }
        empty = text_[pos_ - 1] == '/';
        if (empty && pos_ - start - 1 < name.size()) {
            name = name.substr(0, pos_ - start - 1);
        }
        ++pos_;
        return std::nullopt;
    }

    // After the opening tag of a scalar element: text, comments and CDATA up
    // to and including its closing tag. No element may nest inside.
    qm::MaybeError skipScalarContent(std::string_view name) {
        for (;;) {
            std::size_t open = text_.find('<', pos_);
            if (open == std::string_view::npos) {
                return malformed("missing </" + std::string(name) + ">");
            }
            pos_ = open + 1;
            if (startsWith("!--")) {
                pos_ += 3;
                if (auto error = skipPast("-->", false)) {
                    return error;
                }
                continue;
            }
            if (startsWith("![CDATA[")) {
                pos_ += 8;
                if (auto error = skipPast("]]>", false)) {
                    return error;
                }
                continue;
            }
            if (!startsWith("/")) {
                return malformed("element inside <" + std::string(name) + ">");
            }
            ++pos_;
            if (!startsWith(name)) {
                return malformed("mismatched closing tag for <" + std::string(name) + ">");
            }
            pos_ += name.size();
            skipSpace();
            if (atEnd() || text_[pos_] != '>') {
                return malformed("mismatched closing tag for <" + std::string(name) + ">");
            }
            ++pos_;
            return std::nullopt;
        }
    }

    std::string_view text_;
    unsigned maxNesting_;
    std::size_t pos_ = 0;
};

}  // namespace

qm::MaybeError checkXmlStructure(std::string_view text, unsigned maxNesting) {
    return XmlWalk(text, maxNesting).run();
}

}  // namespace qm::plist
