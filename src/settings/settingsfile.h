#pragma once

#include <QString>
#include <QVariant>

// Values of the settings file, parsed once per version of the file: every read looks at the file's
// identity and times, and parses it again whenever it was edited or replaced, so an edit still takes
// effect at the very next read while an unchanged file costs one stat.
class SettingsFile
{
public:
    // As QSettings in INI form reads "group/key", default included.
    static QVariant value(const QString &group, const QString &key, const QVariant &defaultValue = QVariant());
    static bool exists();
    // Logs a warning about the settings once per version of the file, not at every read.
    static void warnOncePerVersion(const QString &text);

    // While one lives on a thread, that thread looks at the file once: one request answered under one
    // version of the settings, for the price of one stat.
    class OneLook
    {
    public:
        OneLook();
        ~OneLook();
        OneLook(const OneLook &) = delete;
        OneLook &operator=(const OneLook &) = delete;
    };
};
