#include "tools/zrctl/Table.h"

#include <algorithm>

#include "tools/zrctl/Terminal.h"

namespace zrctl {

Table::Table(std::vector<std::string> heading) : widths_(heading.size()) {
    add(std::move(heading));
}

void Table::add(std::vector<std::string> cells) {
    for (std::size_t column = 0; column < cells.size(); ++column) {
        std::string& cell = cells[column];
        cell = cell.empty() ? "-" : terminal::safe(cell);
        widths_[column] = std::max(widths_[column], terminal::width(cell));
    }
    rows_.push_back(std::move(cells));
}

std::string Table::text() const {
    std::string text;
    for (const std::vector<std::string>& row : rows_) {
        for (std::size_t column = 0; column < row.size(); ++column) {
            text += row[column];
            if (column + 1 == row.size()) break;
            text.append(widths_[column] - terminal::width(row[column]) + 2, ' ');
        }
        text += '\n';
    }
    return text;
}

}  // namespace zrctl
