#pragma once

#include <initializer_list>
#include <optional>
#include <regex>
#include <string>
#include <string_view>
#include <vector>

namespace bench {

/// What a figure has to reach.
struct Target {
    enum class Kind {
        None,
        RatioAtMost,   // times what stands beside it
        RatioAtLeast,  // the same, for rates
        ValueAtMost,   // in the figure's own unit
    };
    Kind kind = Kind::None;
    double limit = 0;
};

/// Something that was measured, with what stands beside it from the same run.
struct Figure {
    std::string key;    // without its source: "small/p50"
    std::string title;  // for people
    double value = 0;
    std::string unit = "µs";
    std::string besideSource = {};  // "echo" or "baseline"
    std::optional<double> beside = {};
    Target now = {};   // to reach now
    Target goal = {};  // where we are going

    std::optional<double> ratio() const;
    /// A target in the figure's own unit; none without one.
    std::optional<double> limitOf(const Target& target) const;
    /// None without a target.
    std::optional<bool> met() const;
};

/// The figures in the order in which they were measured, in sections (one per way of running).
class Report {
  public:
    /// Of figures whose keys contain a match of `only`, if one is given.
    explicit Report(std::optional<std::regex> only) : only_(std::move(only)) {}

    /// Begins a section. `suffix` is appended to the keys of its figures.
    void begin(std::string title, std::string suffix);
    /// Whether a figure with one of these keys is asked for, in the section that was begun last.
    bool wants(std::initializer_list<std::string_view> keys) const;
    void add(Figure figure);

    /// Lines "key<TAB>value<TAB>unit".
    std::string tsv() const;
    /// A table for people.
    std::string table() const;

  private:
    struct Section {
        std::string title;
        std::string suffix;
        std::vector<Figure> figures;
    };
    std::optional<std::regex> only_;
    std::vector<Section> sections_;
};

}  // namespace bench
