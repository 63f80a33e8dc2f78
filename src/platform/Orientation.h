#pragma once
// Orientation notifications of the audio toolbox: the device's physical orientation
// and the user interface's, delivered to callbacks registered under an identifier.
// Registering does not report the current orientation: only changes after it.

#include <cstdint>
#include <functional>
#include <string>

#include "platform/ProcessWide.h"

namespace mx {

class Orientation {
public:
    virtual ~Orientation() = default;
    // From now on `callback` runs, on a thread of the orientation service, on every
    // change. Registering again under the same identifier replaces the callback.
    // Callable from any thread.
    virtual void registerDeviceOrientation(const std::string& identifier, std::function<void(int)> callback) = 0;
    virtual void registerUIOrientation(const std::string& identifier, std::function<void(int)> callback) = 0;
    // Ends the registration; no callback of it starts after this returns, and one
    // running on another thread has returned. Callable from a callback too.
    virtual void unregisterDeviceOrientation(const std::string& identifier) = 0;
    virtual void unregisterUIOrientation(const std::string& identifier) = 0;
    virtual std::string orientationName(int orientation) = 0;
};

} // namespace mx
