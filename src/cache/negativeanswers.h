#pragma once

#include "fileversion.h"

#include <QDeadlineTimer>
#include <QHash>
#include <QString>

// Names and uids the domain server said do not exist, answered "no" without asking it again while the
// answer stands ("negative-cache-timeout"). A look-up that finds the account or a login ends it early for
// that account; any change of the settings file ends all of them.
class NegativeAnswers
{
public:
    bool holds(const QString &name);
    bool holds(uint uid);
    void remember(const QString &name);
    void remember(uint uid);
    void forget(const QString &name, uint uid = 0);

    // Unknown names cost a hash entry each; past this many, the oldest answers are not worth keeping.
    static const int limit = 4096;

private:
    bool settingsChanged();
    QDeadlineTimer standing();

    QHash<QString, QDeadlineTimer> m_names;
    QHash<uint, QDeadlineTimer> m_uids;
    FileVersion m_settings;
};
