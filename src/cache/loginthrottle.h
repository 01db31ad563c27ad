#pragma once

#include <QHash>
#include <QString>

// Failed password checks per account, so that nobody can guess a password by trying many. After
// "max-failed-logins" consecutive failures (0: no limit) an account is locked until "failed-login-delay"
// seconds have passed since its last failure. The counts survive a restart of the daemon: they are kept
// in a root-only file of the working directory.
class LoginThrottle
{
public:
    // The file the counts are kept in; by default the one of the working directory.
    explicit LoginThrottle(const QString &stateFile = defaultStateFile());

    static QString defaultStateFile();

    // Seconds since the epoch until which the account stays locked; 0 when it is not locked.
    qint64 lockedUntil(uint uid) const;
    // A wrong password; the lock that it begins, if any, is logged.
    void recordFailure(uint uid, const QString &account);
    void recordSuccess(uint uid);

private:
    struct Failures {
        int count = 0;
        qint64 last = 0;
    };

    static int limit();
    static qint64 delay();
    void load();
    bool save() const;

    QString m_stateFile;
    QHash<uint, Failures> m_failures;
};
