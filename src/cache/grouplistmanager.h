#pragma once

#include <QList>
#include <QObject>
#include <QSharedPointer>
#include <QStringList>

struct GroupEntry {
    uint gid = 0;
    QString name;
    QString password;
    QStringList members;
};
using GroupEntryPtr = QSharedPointer<GroupEntry>;

// The private group file that makes network users members of local groups, merged with the
// machine's own group records as the "files" name-service module sees them.
class GroupListManager : public QObject
{
    Q_OBJECT

public:
    explicit GroupListManager(QObject *parent = nullptr);
    ~GroupListManager() override;

    void loadGroups();
    // False when the file could not be replaced; it then keeps what it held.
    bool saveGroups();
    void addGroupMember(const QString &name, const QString &user);
    void addUserToGroup(const QString &name, const QString &user);
    void removeGroupMember(const QString &name, const QString &user);
    void removeUserFromGroups(const QString &user);
    void removeDomainMembers();
    QStringList groupsOfUser(const QString &user) const;
    // The lowest gid of 5000-9999 that neither the list nor the machine's own groups use; 0 when none is left.
    uint nextFreeGid() const;

    QList<GroupEntryPtr> groups() const;
    GroupEntryPtr findGroup(const QString &name) const;
    // Name of the machine's group with this gid, through the "files" module; empty when unknown.
    QString systemGroupName(uint gid) const;

private:
    bool lookupSystemGroup(const QString &name, GroupEntry &entry) const;

    QList<GroupEntryPtr> m_groups;
    void *m_library = nullptr;
};
