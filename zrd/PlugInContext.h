#pragma once

#include <memory>
#include <optional>

#include "platform/Value.h"

namespace platform {
class Consent;
class Types;
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
    std::shared_ptr<platform::Consent> consent;
    std::shared_ptr<platform::Types> types;
};

}  // namespace zorvan
