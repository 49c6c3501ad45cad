#include "bench/Report.h"

#include <fmt/core.h>

#include <algorithm>
#include <utility>

namespace bench {

namespace {

std::string readable(double value, const std::string& unit) {
    if (unit == "µs" && value >= 10e3) return fmt::format("{:.1f} ms", value / 1e3);
    if (unit == "B" || unit == "1/s") return fmt::format("{:.0f} {}", value, unit);
    if (unit == "x") return fmt::format("{:.2f} x", value);
    return fmt::format("{:.1f} {}", value, unit);
}

std::string readable(const Target& target, const Figure& figure) {
    switch (target.kind) {
        case Target::Kind::None:
            return "";
        case Target::Kind::ValueAtMost:
            return readable(target.limit, figure.unit);
        default:
            return fmt::format("{:.1f} x {}", target.limit, figure.besideSource);
    }
}

}  // namespace

std::optional<double> Figure::ratio() const {
    if (!beside || *beside <= 0) return {};
    return value / *beside;
}

std::optional<double> Figure::limitOf(const Target& target) const {
    if (target.kind == Target::Kind::None) return {};
    if (target.kind == Target::Kind::ValueAtMost) return target.limit;
    if (!beside) return {};
    return target.limit * *beside;
}

std::optional<bool> Figure::met() const {
    if (now.kind == Target::Kind::None) return {};
    const auto limit = limitOf(now);
    return limit && (now.kind == Target::Kind::RatioAtLeast ? value >= *limit : value <= *limit);
}

void Report::begin(std::string title, std::string suffix) {
    sections_.push_back({std::move(title), std::move(suffix), {}});
}

bool Report::wants(std::initializer_list<std::string_view> keys) const {
    return !only_ || std::ranges::any_of(keys, [this](std::string_view key) {
        return std::regex_search(std::string(key) + sections_.back().suffix, *only_);
    });
}

void Report::add(Figure figure) {
    if (!wants({figure.key})) return;
    sections_.back().figures.push_back(std::move(figure));
}

std::string Report::tsv() const {
    std::string out;
    for (const Section& section : sections_) {
        for (const Figure& figure : section.figures) {
            const std::string key = figure.key + section.suffix;
            out += fmt::format("zrd/{}\t{:.2f}\t{}\n", key, figure.value, figure.unit);
            for (const auto& [name, target] :
                 {std::pair("limit", figure.now), {"goal", figure.goal}})
                if (const auto limit = figure.limitOf(target))
                    out += fmt::format("{}/{}\t{:.2f}\t{}\n", name, key, *limit, figure.unit);
            if (!figure.beside) continue;
            out += fmt::format("{}/{}\t{:.2f}\t{}\n", figure.besideSource, key, *figure.beside,
                               figure.unit);
            if (auto ratio = figure.ratio())
                out += fmt::format("ratio/{}\t{:.3f}\tx\n", key, *ratio);
        }
    }
    return out;
}

std::string Report::table() const {
    std::string out;
    for (const Section& section : sections_) {
        out += fmt::format("\n{}\n{:<46}{:>13}{:>13}{:>9}  {:<15}{:<5}{}\n", section.title,
                           "figure", "zrd", "beside", "ratio", "to reach now", "met", "goal");
        for (const Figure& figure : section.figures) {
            const auto ratio = figure.ratio();
            const auto met = figure.met();
            out += fmt::format("{:<46}{:>13}{:>13}{:>9}  {:<15}{:<5}{}\n", figure.title,
                               readable(figure.value, figure.unit),
                               figure.beside ? readable(*figure.beside, figure.unit) : "",
                               ratio ? fmt::format("{:.2f} x", *ratio) : "",
                               readable(figure.now, figure), met ? (*met ? "yes" : "NO") : "",
                               readable(figure.goal, figure));
        }
    }
    return out;
}

}  // namespace bench
