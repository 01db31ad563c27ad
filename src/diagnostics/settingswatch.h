#pragma once

#include "fileversion.h"

#include <QObject>
#include <QString>

class QTimer;

// The daemon's eye on its settings file: checks it at start and again whenever it changes, and tells
// each finding once per version of the file, on the log and, from a terminal, on standard error.
class SettingsWatch : public QObject
{
    Q_OBJECT

public:
    explicit SettingsWatch(const QString &path, bool toTerminal, QObject *parent = nullptr);

    // Checks now, and then once a second for a new version.
    void start(int intervalMs = 1000);
    int lastStatus() const { return m_lastStatus; }

private Q_SLOTS:
    void look();

private:
    void report();

    QString m_path;
    bool m_toTerminal;
    bool m_looked = false;
    FileVersion m_version;
    int m_lastStatus = 0;
    QTimer *m_timer;
};
