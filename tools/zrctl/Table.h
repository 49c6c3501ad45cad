#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace zrctl {

/// A table for a terminal: a heading and rows, in columns as wide as their widest cell. Cells may
/// hold any bytes; they are made safe. Empty cells are written as "-".
class Table {
  public:
    explicit Table(std::vector<std::string> heading);

    /// As many cells as the heading has.
    void add(std::vector<std::string> cells);
    /// One line a row, the heading first; the last column is not padded.
    std::string text() const;

  private:
    std::vector<std::vector<std::string>> rows_;
    std::vector<std::size_t> widths_;  // of the columns, in terminal columns
};

}  // namespace zrctl
