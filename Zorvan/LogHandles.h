#pragma once

#include "platform/Log.h"

namespace zorvan {

using platform::pub;

/// The log handles of the subsystem "com.orbel.Zorvan", one a category. All four are made by the
/// first call of any; a handle that cannot be made is the default handle, after an error line.
const platform::Log& ops();        // everything that the others do not take
const platform::Log& traffic();    // the client stub's requests and replies
const platform::Log& extension();  // each attribute filter that matching evaluates
const platform::Log& td();         // raw data of the application registry

}  // namespace zorvan
