#include "platform/plist/PropertyListCost.h"

#include <string_view>
#include <vector>

#include "platform/plist/PropertyListLimits.h"
#include "platform/plist/PropertyListWork.h"

namespace platform {

namespace {

/// Adds up what a value becomes.
class CostSum {
  public:
    void add(const Value& value) {
        ++cost_.objects;
        if (const auto* text = value.string()) addText(*text);
        if (const Data* data = value.data()) cost_.bytes += data->bytes().size() / 3 * 4;
        if (const Array* array = value.array())
            for (const Value& element : *array) add(element);
        if (const Dictionary* dictionary = value.dictionary()) addEntries(*dictionary);
    }

    PropertyListCost cost() const {
        PropertyListCost cost = cost_;
        cost.work = isTooMuchWork_ ? PropertyListWork::kMost + 1 : work_.used();
        return cost;
    }

  private:
    void addText(std::string_view text) {
        std::size_t size = text.size();
        std::size_t references = 0;
        for (char character : text) {
            if (character != '&' && character != '<' && character != '>') continue;
            ++references;
            size += character == '&' ? 4 : 3;
        }
        cost_.bytes += size;
        if (work_.addText(references, size)) isTooMuchWork_ = true;
    }

    void addEntries(const Dictionary& dictionary) {
        std::vector<std::string_view> keys;
        keys.reserve(dictionary.size());
        for (const auto& [key, value] : dictionary) {
            ++cost_.objects;
            addText(key);
            keys.push_back(key);
            add(value);
        }
        if (work_.addKeys(keys)) isTooMuchWork_ = true;
    }

    PropertyListCost cost_;
    PropertyListWork work_;
    bool isTooMuchWork_ = false;
};

}  // namespace

PropertyListCost& PropertyListCost::operator+=(const PropertyListCost& other) {
    objects += other.objects;
    bytes += other.bytes;
    work += other.work;
    return *this;
}

PropertyListCost& PropertyListCost::operator-=(const PropertyListCost& other) {
    objects -= other.objects;
    bytes -= other.bytes;
    work -= other.work;
    return *this;
}

bool PropertyListCost::isReadable() const {
    // The element around them all is one of the reader's objects.
    return objects < kMaxPropertyListObjects && work <= PropertyListWork::kMost;
}

bool PropertyListCost::fits(std::size_t limit, std::size_t parts) const {
    // Tags and the deepest indentation of one object's line.
    constexpr std::size_t kMostAround = 192;
    return objects < kMaxPropertyListObjects / 2 / parts &&
           bytes + objects * kMostAround <= limit / parts &&
           work <= PropertyListWork::kMost / 2 / parts;
}

PropertyListCost costOfPropertyList(const Value& value) {
    CostSum sum;
    sum.add(value);
    return sum.cost();
}

}  // namespace platform
