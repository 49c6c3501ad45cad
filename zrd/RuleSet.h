#pragma once

#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <variant>
#include <vector>

#include "platform/services/Types.h"
#include "platform/values/Value.h"
#include "zrd/TextPatterns.h"

namespace zorvan {

/// The pattern of a rule, read once to be asked of many values. Used by one thread at a time.
class RulePattern {
  public:
    /// `types` may be null while the pattern does not speak of types.
    RulePattern(const platform::Value& pattern, const std::shared_ptr<platform::Types>& types);

    /// Whether it holds for a property's value; null: there is none.
    bool matches(const platform::Value* value) const;

  private:
    struct Present {};
    struct Absent {};
    struct Never {};
    struct Offer {
        platform::Dictionary dictionary;  // for the log
        std::shared_ptr<const platform::ActivationOffer> offer;
    };
    /// Patterns with an operator that does not exist among them: who meets it is told, every time,
    /// which takes a walk over them. So many walks are made.
    struct Told {
        std::vector<std::string> patterns;
        std::shared_ptr<platform::Types> types;
        std::size_t walks;
    };
    struct Texts {
        TextPatterns patterns;
        mutable std::optional<Told> told;
    };
    using Content = std::variant<Present, Absent, Never, Offer, Texts>;

    static Content read(const platform::Value& pattern,
                        const std::shared_ptr<platform::Types>& types);
    static bool holds(const Texts& texts, std::string_view text);

    Content content_;
};

/// Rules, read once to be asked of many plug-ins. Used by one thread at a time.
class RuleSet {
  public:
    struct Rule {
        std::string key;
        RulePattern pattern;
    };

    /// Whether rules may be asked of all plug-ins while everybody waits: each rule costs a look at
    /// each plug-in, and reading them costs their bytes. `times` as much may be asked of what is
    /// not every stranger's to send.
    static bool isAffordable(const platform::Dictionary& rules, std::size_t times = 1);
    static constexpr std::size_t kMaxRules = 64;
    static constexpr std::size_t kMaxValues = 4096;       // those inside others included
    static constexpr std::size_t kMaxBytes = 256u << 10;  // of keys, strings and data

    RuleSet(const platform::Dictionary& rules, const std::shared_ptr<platform::Types>& types);

    /// In the order of their keys.
    const std::vector<Rule>& rules() const { return rules_; }

  private:
    std::vector<Rule> rules_;
};

}  // namespace zorvan
