#pragma once

#include <QList>
#include <QString>

// One fault found in the settings file: where it is and what is wrong.
struct SettingsFinding {
    enum class Severity { Warning, Error };
    Severity severity;
    QString group; // empty for the file as a whole
    QString key; // empty for a group or the file
    int line; // 0 when the fault has no line
    QString message;

    // "path:line: error: [group] key: message", as a compiler would put it.
    QString text(const QString &path) const;
};

// Reads the settings file the way the daemons do and reports what they would misread, ignore or
// be unable to use: unknown groups and keys, values of the wrong type or range, certificate and key
// files that cannot serve.
class SettingsCheck
{
public:
    static QList<SettingsFinding> check(const QString &path);
    // 0 clean, 1 warnings only, 2 errors.
    static int exitStatus(const QList<SettingsFinding> &findings);
};
