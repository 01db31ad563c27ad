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
};
