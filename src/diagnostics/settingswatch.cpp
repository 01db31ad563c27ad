#include "settingswatch.h"

#include "settingscheck.h"

#include <QDebug>
#include <QTimer>

#include <cstdio>

SettingsWatch::SettingsWatch(const QString &path, bool toTerminal, QObject *parent)
    : QObject(parent)
    , m_path(path)
    , m_toTerminal(toTerminal)
    , m_timer(new QTimer(this))
{
    connect(m_timer, &QTimer::timeout, this, &SettingsWatch::look);
}

void SettingsWatch::start(int intervalMs)
{
    look();
    m_timer->start(intervalMs);
}

void SettingsWatch::look()
{
    const FileVersion now = FileVersion::of(m_path);
    if (m_looked && now == m_version)
        return;
    m_looked = true;
    m_version = now;
    report();
}

void SettingsWatch::report()
{
    const QList<SettingsFinding> findings = SettingsCheck::check(m_path);
    m_lastStatus = SettingsCheck::exitStatus(findings);
    for (const SettingsFinding &finding : findings) {
        const QString line = finding.text(m_path);
        if (finding.severity == SettingsFinding::Severity::Error)
            qCritical().noquote() << line;
        else
            qWarning().noquote() << line;
        if (m_toTerminal)
            fprintf(stderr, "%s\n", line.toLocal8Bit().constData());
    }
}
