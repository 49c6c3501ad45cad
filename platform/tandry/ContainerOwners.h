#pragma once

#include <functional>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "platform/system/Error.h"
#include "platform/tandry/SharedTexts.h"
#include "platform/values/Value.h"

namespace platform::tandry {

/// Who wants a data container: a plug-in identifier, which anybody may claim, at one place, which
/// nobody else has.
struct ContainerClaim {
    std::string identifier;  // a safe file name
    std::string place;       // canonical path of the containing application, else of the bundle
    std::optional<std::string> application;  // that application's bundle identifier, may be empty
    bool isRemembered = false;               // the catalogue knew this plug-in at this path
};

/// Whose each data container is, in a property list beside the containers, where no sandbox leads.
/// Belongs to the registry's thread.
///
/// The first claimant of an identifier has the container of that name. Others have containers of
/// their own, whose names follow from identifier and place and begin with ".", so that no
/// identifier can be one.
///
/// A container stays its owner's until the owner's place is gone from the disk and an application
/// with the same bundle identifier claims the same plug-in identifier elsewhere, be it moved or
/// updated under another name (a bundle outside applications is followed by its own identifier).
/// Who has a container already keeps that one. An application without an identifier is followed
/// only where a symbolic link leads from its old place to the new one.
///
/// Containers that nobody is known to own, from before there was this file, go to the first
/// claimant. Once a damaged file had to be set aside (an error line says so) this is no longer
/// safe: then such a container goes only to whom the catalogue remembers with its identifier, and
/// stays untouched, with an error line, when anybody else claims it.
class ContainerOwners {
  public:
    /// Whether there is a container of a name.
    using Exists = std::function<bool(const std::string& name)>;

    /// Nothing is read yet.
    explicit ContainerOwners(std::string file) : file_(std::move(file)) {}

    /// Reads the file unless that has been done. Error: it can be neither read nor set aside, so
    /// that nobody's container is known, and none may be given.
    std::optional<Error> load();

    /// The name of the claimant's container. Only when loaded.
    std::string nameFor(const ContainerClaim& claim, const Exists& exists);

    /// Stores what has changed, if anything has. A failure is told once, and the next call tries
    /// again.
    void save();

  private:
    /// There may be one for each plug-in: what neighbours have in common is shared.
    struct Owner {
        SharedText place;
        SharedText application;  // null when it has none
        std::string container;
    };
    using Owners = std::vector<Owner>;  // of one identifier, in the order of their places

    std::optional<Error> read();
    bool take(const std::string& place, const Dictionary& entry);
    Dictionary contents() const;
    static Owners::iterator find(Owners& owners, const std::string& place);
    void put(Owners& owners, const std::string& place, std::string container,
             const std::optional<std::string>& application);
    static Owners::iterator findFormer(Owners& owners, const ContainerClaim& claim);
    std::string unownedName(const ContainerClaim& claim, Owners& owners, const Exists& exists);

    const std::string file_;
    std::map<std::string, Owners> owners_;  // by plug-in identifier
    SharedTexts places_;
    SharedTexts applications_;
    bool isLoaded_ = false;
    bool isChanged_ = false;
    bool wasDamaged_ = false;  // once, maybe long ago: containers without an owner may be anybody's
    std::string problem_;      // what the log was told last of saving
};

}  // namespace platform::tandry
