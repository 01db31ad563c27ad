#pragma once

#include "accountmap.h"
#include "changewatch.h"
#include "fileversion.h"

#include <QMap>
#include <QObject>
#include <QTimer>

#include <optional>

class NegativeAnswers;
class UserListManager;

// Keeps the account map under /run true to the cache store, the group list, the "enable" switch and the
// daemon's negative answers: rebuilt when the daemon has written an account, shortly after any other
// process changes the files it is made from, and shortly after a negative answer begins or ends; withdrawn
// while the switch is off. It is left in place when the daemon stops, so that the accounts it holds are
// still answered. After the first build only the records that inotify names are read again; the whole
// cache folder is walked again only when events were lost or the settings file changed.
class AccountMapPublisher : public QObject
{
    Q_OBJECT

public:
    // users: the daemon's user list, which decides which account a name belongs to; negatives: the
    // daemon's negative answers, published with its pid (none when null).
    explicit AccountMapPublisher(
        const UserListManager *users, NegativeAnswers *negatives = nullptr, QObject *parent = nullptr);
    ~AccountMapPublisher() override;

    // Milliseconds from a change by another process to the rebuild.
    static const int settleMs = 5;

public Q_SLOTS:
    // Accounts may have changed. False when the map could not be written (logged).
    bool publish();
    // Rewritten shortly after, with the accounts laid out again only if their files changed meanwhile.
    void negativeAnswersChanged();
    // The daemon stops: its negative answers leave the map, which the module heeds only while it runs.
    void dropNegativeAnswers();

private:
    struct Kept {
        FileVersion version;
        // Read once the file had settled: while it stays the same, a walk need not read it again.
        bool settled = false;
        std::optional<AccountMap::Account> account;
    };
    bool rewrite(bool accountsChanged);
    // True when what the map holds of the accounts may have changed.
    bool readChanges();
    void readRecord(quint32 uid);
    void readAllRecords();
    AccountMap collect() const;
    QList<AccountMap::NegativeAnswer> standingNegatives();
    std::optional<AccountMap::Account> readAccount(quint32 uid) const;
    void withdraw();

    const UserListManager *m_users;
    NegativeAnswers *m_negatives;
    ChangeWatch *m_watch;
    QTimer m_settle;
    // Drops the negative answers that ended, so that a clock set back cannot stretch them.
    QTimer m_expiry;
    bool m_walkDue = true;
    // Each record as last read, by uid: in uid order, so that the lowest uid of a name is the one found.
    QMap<quint32, Kept> m_kept;
    QByteArray m_accountPart;
    QByteArray m_published;
    FileVersion m_publishedVersion;
};
