#pragma once

// The client library of the Bexil plug-in registry: include this one header and link with
// `pkg-config --cflags --libs bexil`.

#include "bexil/DaemonClient.h"
#include "bexil/Interface.h"
#include "bexil/TypedConnection.h"

#define BEXIL_VERSION_MAJOR 0
#define BEXIL_VERSION_MINOR 1

namespace bexil {

// The library's version as "major.minor.patch".
const char* libraryVersion();

}  // namespace bexil
