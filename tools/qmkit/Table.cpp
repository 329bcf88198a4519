#include "Table.h"

#include <algorithm>
#include <cassert>

#include "ReplyFormat.h"
#include "platform/value/Value.h"

std::string Table::text() const {
    std::vector<std::size_t> widths;
    for (const Column& column : columns) {
        widths.push_back(column.heading.size());
    }
    for (const auto& row : rows) {
        assert(row.size() == columns.size());
        for (std::size_t i = 0; i < row.size(); ++i) {
            widths[i] = std::max(widths[i], row[i].size());
        }
    }
    std::string out;
    auto appendLine = [&](auto cellAt) {
        for (std::size_t i = 0; i < columns.size(); ++i) {
            const std::string& cell = cellAt(i);
            out += cell;
            if (i + 1 < columns.size()) {
                out.append(widths[i] - cell.size() + 2, ' ');
            }
        }
        out += '\n';
    };
    appendLine([&](std::size_t i) -> const std::string& { return columns[i].heading; });
    for (const auto& row : rows) {
        appendLine([&](std::size_t i) -> const std::string& { return row[i]; });
    }
    return out;
}

std::string Table::json(const std::string& key) const {
    qm::Array objects;
    for (const auto& row : rows) {
        qm::Dictionary object;
        for (std::size_t i = 0; i < columns.size(); ++i) {
            object.set(columns[i].key, qm::Value(row[i]));
        }
        objects.emplace_back(std::move(object));
    }
    return replyAsJson(qm::Value(qm::Dictionary{{key, qm::Value(std::move(objects))}}));
}
