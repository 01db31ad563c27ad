#pragma once

#include "accountmap.h"
#include "fileversion.h"

#include <QHash>
#include <QObject>
#include <QTimer>

#include <optional>

class ChangeWatch;
class UserListManager;

// Keeps the account map under /run true to the cache store, the group list and the "enable" switch:
// rebuilt when the daemon has written an account, and shortly after any other process changes the files
// it is made from; withdrawn while the switch is off. It is left in place when the daemon stops, so that
// the accounts it holds are still answered.
class AccountMapPublisher : public QObject
{
    Q_OBJECT

public:
    // users: the daemon's user list, which decides which account a name belongs to.
    explicit AccountMapPublisher(const UserListManager *users, QObject *parent = nullptr);
    ~AccountMapPublisher() override;

    // What the map would hold now.
    AccountMap collect();
    // Milliseconds from a change by another process to the rebuild.
    static const int settleMs = 5;

public Q_SLOTS:
    // False when the map could not be written (logged).
    bool publish();

private:
    struct Kept {
        FileVersion version;
        std::optional<AccountMap::Account> account;
    };
    std::optional<AccountMap::Account> readAccount(quint32 uid) const;
    void withdraw();

    const UserListManager *m_users;
    ChangeWatch *m_watch;
    QTimer m_settle;
    // Each record as last read, while its file stays the same.
    QHash<quint32, Kept> m_kept;
    QByteArray m_published;
    FileVersion m_publishedVersion;
};
