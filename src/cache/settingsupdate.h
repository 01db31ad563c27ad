#pragma once

#include <functional>

class QSettings;

// Changes to the settings file. They are made on a scratch copy with the usual INI reader and writer,
// and the copy then replaces the file whole, so that no reader ever sees a half-written file.
class SettingsUpdate
{
public:
    // False, logged, when the file could not be replaced; it is then left as it was.
    static bool apply(const std::function<void(QSettings &)> &change);
};
