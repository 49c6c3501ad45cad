#pragma once

#include <memory>
#include <optional>

#include "platform/values/Value.h"

namespace platform {
class Assertions;
class Consent;
class Launcher;
class Sandbox;
class Types;
class Workspace;
}  // namespace platform

namespace zorvan {

class ZRDPlugIn;

/// Answers the user's choices about plug-ins.
class AnnotationReader {
  public:
    virtual std::optional<platform::Dictionary> annotationForPlugIn(const ZRDPlugIn& plugIn) = 0;

  protected:
    ~AnnotationReader() = default;
};

/// What a plug-in record needs of the world around it. Shared by all records of a database.
struct PlugInContext {
    std::weak_ptr<AnnotationReader> annotations;
    std::shared_ptr<platform::Launcher> launcher;
    std::shared_ptr<platform::Assertions> assertions;
    std::shared_ptr<platform::Sandbox> sandbox;
    std::shared_ptr<platform::Consent> consent;
    std::shared_ptr<platform::Types> types;
    std::shared_ptr<platform::Workspace> workspace;
};

}  // namespace zorvan
