#pragma once

#include <memory>
#include <optional>
#include <string>

#include "platform/values/Value.h"

namespace platform {

/// A bundle on disk: a directory with an `Info.plist`. Immutable but for the cached `Info.plist`;
/// usable from any thread.
class LumBundle {
  public:
    enum Mode {
        BundleDirectory = 1,  // the path is the bundle directory
        Executable = 2,       // the path is an executable directly inside a bundle
    };
    enum Property {
        BundlePath = 2,      // the bundle directory
        ExecutablePath = 3,  // the file that "QFBundleExecutable" names; none when it names none
        SupportPath = 9,     // the support files: the bundle directory itself
    };

    /// Null when `path` is not an absolute path. In mode `Executable` a path that lies in no bundle
    /// (its directory has no `Info.plist`) gives an object without a bundle path.
    static std::shared_ptr<LumBundle> make(const std::string& path, Mode mode);
    /// Whether an open directory (borrowed) is a bundle's: it has an `Info.plist`, which may be a
    /// symbolic link, wherever that leads.
    static bool isAt(int directory);
    /// The bundle around this process's own executable.
    static std::shared_ptr<LumBundle> mainBundle();

    std::optional<std::string> property(int number) const;

    /// The `Info.plist`, read once and cached until `discardCache`. None when it is missing, leads
    /// out of the bundle, is no property list, or is no dictionary.
    std::optional<Dictionary> infoDictionary() const;
    void discardCache();

    std::string description() const;

  private:
    struct State;
    explicit LumBundle(std::unique_ptr<State> state);

  public:
    ~LumBundle();

  private:
    std::unique_ptr<State> state_;
};

std::string describe(const LumBundle& bundle);

}  // namespace platform
