#pragma once

#include "platform/log/Log.h"

namespace zorvan {

using platform::pub;

/// The log handles of the subsystem "com.orbel.Zorvan", one a category. All four are made by the
/// first call of any, and live as long as the process.
const platform::Log& ops();        // everything that the others do not take
const platform::Log& traffic();    // the client stub's requests and replies
const platform::Log& extension();  // each attribute filter that matching evaluates
const platform::Log& td();         // raw data of the application registry

}  // namespace zorvan
