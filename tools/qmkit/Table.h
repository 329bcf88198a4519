#pragma once
// What a command lists, as rows of text cells: aligned columns under their
// headings for people, an array of objects (one per row, keyed by column)
// for --json.

#include <string>
#include <vector>

struct Table {
    struct Column {
        std::string key;      // for JSON
        std::string heading;  // for people
    };

    std::vector<Column> columns;
    std::vector<std::vector<std::string>> rows;  // one cell per column

    // The headings, then one line per row; each column but the last padded
    // to its widest cell and two spaces. Ends with a newline.
    std::string text() const;
    // {"<key>": [{"<column key>": "<cell>", ...}, ...]} as pretty JSON, with
    // a trailing newline.
    std::string json(const std::string& key) const;
};
