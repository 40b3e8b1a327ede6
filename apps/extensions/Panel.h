// The Extensions panel's window: the plug-ins by extension point with their election switches and
// a search, a page per plug-in, and "Why is it not offered?". It follows axd's events and shows
// every error axd or the consent store gives, in a bar at the top of the window.
#pragma once

#include <adwaita.h>

namespace annexa::extensions {

// Builds the window of `application`, fills it and starts following axd; it lives as long as the
// window.
void presentPanel(AdwApplication* application);

}  // namespace annexa::extensions
