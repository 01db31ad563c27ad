#pragma once

#include "fileversion.h"

#include <QDeadlineTimer>
#include <QHash>
#include <QList>
#include <QString>

// Names and uids the domain server said do not exist, answered "no" without asking it again while the
// answer stands ("negative-cache-timeout"). A look-up that finds the account or a login ends it early for
// that account; any change of the settings file ends all of them.
class NegativeAnswers
{
public:
    struct Standing {
        QString name; // empty for a uid
        uint uid = 0;
        QDeadlineTimer until;
    };

    bool holds(const QString &name);
    bool holds(uint uid);
    void remember(const QString &name);
    void remember(uint uid);
    // True when an answer for name or uid stood.
    bool forget(const QString &name, uint uid = 0);
    // The answers that stand now; those that ended are dropped.
    QList<Standing> current();

    // Unknown names cost a hash entry each; past this many, the oldest answers are not worth keeping.
    static const int limit = 4096;

private:
    bool settingsChanged();
    QDeadlineTimer standing();

    QHash<QString, QDeadlineTimer> m_names;
    QHash<uint, QDeadlineTimer> m_uids;
    FileVersion m_settings;
};
