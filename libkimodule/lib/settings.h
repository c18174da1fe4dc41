// Where the package keeps its settings. For the library itself and the programs built with it; not
// installed.
#pragma once

// A key-value file (see fileutils.h) of all programs of the package.
constexpr const char* SETTINGS_FILE = "/var/packages/Camveld/etc/settings.conf";
