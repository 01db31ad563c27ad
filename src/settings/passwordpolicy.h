#pragma once

#include <QJsonObject>

class QSettings;

// The password policy groups of the settings file, read for the desktop and written on command.
class PasswordPolicy
{
public:
    static const char *const groupNames[5];

    // Every key of every group, converted to its type; absent keys give false, 0 or "".
    static QJsonObject read(const QSettings &settings);
    // Writes only the keys present in each group object of policy.
    static void write(QSettings &settings, const QJsonObject &policy);
};
