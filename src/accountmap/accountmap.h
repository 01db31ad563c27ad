#pragma once

#include <QByteArray>
#include <QList>

// The accounts and the group list the name-service module may show, laid out as the module reads them
// (account-map-format.h): hash indexes over one block, read in place.
class AccountMap
{
public:
    struct Account {
        quint32 uid = 0;
        quint32 gid = 0;
        QByteArray name;
        QByteArray gecos;
        QByteArray home;
        QByteArray shell;
    };

    // byName: whether a look-up by name answers it (a look-up by uid always does); the first account of
    // a name or uid is the one found.
    void addAccount(const Account &account, bool byName);
    // The group list file's text, read as the module reads the file: "name:password:gid:members" lines
    // with a decimal gid other than 0; the first line of a name or gid is the one found.
    void setGroupList(const QByteArray &text);

    // A name or uid the domain server said does not exist; until: seconds since the epoch.
    struct NegativeAnswer {
        QByteArray name; // empty for a uid
        quint32 uid = 0;
        qint64 until = 0;
    };

    int accountCount() const { return m_accounts.size(); }
    // Without negative answers: those change far more often than the accounts, and are laid behind them.
    QByteArray toBytes() const;
    // bytes (of toBytes()) with its negative answers replaced by answers, which the module heeds while the
    // process daemonPid runs.
    static QByteArray withNegativeAnswers(
        const QByteArray &bytes, const QList<NegativeAnswer> &answers, quint32 daemonPid);

private:
    struct Group {
        quint32 gid = 0;
        QByteArray name;
        QByteArray password;
        QList<QByteArray> members;
    };

    QList<Account> m_accounts;
    QList<bool> m_byName;
    QList<Group> m_groups;
};
