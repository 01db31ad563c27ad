#include "loginthrottle.h"

#include "kestpaths.h"
#include "settingsfile.h"
#include "wholefile.h"

#include <QDateTime>
#include <QDebug>
#include <QFile>
#include <QJsonDocument>
#include <QJsonObject>

namespace
{
const QString kMain = QStringLiteral("main");
const QString kCount = QStringLiteral("failures");
const QString kLast = QStringLiteral("last");

qint64 now()
{
    return QDateTime::currentSecsSinceEpoch();
}
} // namespace

LoginThrottle::LoginThrottle(const QString &stateFile)
    : m_stateFile(stateFile)
{
    load();
}

QString LoginThrottle::defaultStateFile()
{
    return KestPaths::workDir() + QStringLiteral("/failed-logins");
}

int LoginThrottle::limit()
{
    return qMax(0, SettingsFile::value(kMain, QStringLiteral("max-failed-logins"), 3).toInt());
}

qint64 LoginThrottle::delay()
{
    return qMax(0, SettingsFile::value(kMain, QStringLiteral("failed-login-delay"), 300).toInt());
}

qint64 LoginThrottle::lockedUntil(uint uid) const
{
    const int max = limit();
    const auto found = m_failures.constFind(uid);
    if (max == 0 || found == m_failures.cend() || found->count < max)
        return 0;
    const qint64 until = found->last + delay();
    return until > now() ? until : 0;
}

void LoginThrottle::recordFailure(uint uid, const QString &account)
{
    const int max = limit();
    Failures &failures = m_failures[uid];
    // A lock that has run out gives the account its full number of tries again.
    if (max > 0 && failures.count >= max)
        failures.count = 0;
    ++failures.count;
    failures.last = now();
    save();
    if (max > 0 && failures.count == max)
        qWarning().noquote() << QStringLiteral("account locked after %1 failed password checks: %2, for %3 seconds.")
                                    .arg(max)
                                    .arg(account)
                                    .arg(delay());
}

void LoginThrottle::recordSuccess(uint uid)
{
    if (m_failures.remove(uid) > 0)
        save();
}

void LoginThrottle::load()
{
    QFile file(m_stateFile);
    if (!file.open(QIODevice::ReadOnly))
        return;
    const QJsonObject accounts = QJsonDocument::fromJson(file.readAll()).object();
    for (auto account = accounts.constBegin(); account != accounts.constEnd(); ++account) {
        bool isNumber = false;
        const uint uid = account.key().toUInt(&isNumber);
        const QJsonObject entry = account.value().toObject();
        if (!isNumber || entry.value(kCount).toInt() <= 0)
            continue;
        m_failures.insert(uid, { entry.value(kCount).toInt(), qint64(entry.value(kLast).toDouble()) });
    }
}

bool LoginThrottle::save() const
{
    QJsonObject accounts;
    for (auto failures = m_failures.constBegin(); failures != m_failures.constEnd(); ++failures)
        accounts.insert(QString::number(failures.key()),
            QJsonObject { { kCount, failures->count }, { kLast, double(failures->last) } });
    QString error;
    return WholeFile::write(m_stateFile, QJsonDocument(accounts).toJson(QJsonDocument::Compact),
        QFileDevice::ReadOwner | QFileDevice::WriteOwner, error);
}
