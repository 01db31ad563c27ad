#pragma once

#include <QDBusConnection>
#include <QDBusMessage>
#include <QList>
#include <QString>
#include <QVariant>

// Helpers shared by the front service tests: cached accounts in the test root and calls to the service.

struct TestAccount {
    uint uid;
    uint gid;
    QString name;
    QString password;
    QString home;
    QString shell;
    QString gecos;
    uint removeStatus = 0;
};

TestAccount testAccount(uint uid, const QString &name);
// Writes the account's cache record through the cache store, into the current test root.
bool writeCacheRecord(const TestAccount &account);
bool writeCacheRecords(const QList<TestAccount> &accounts);
// The uids that have a record file in the test root, sorted.
QList<uint> cachedUids();

QString servicePath();
QString userObjectPath(uint uid);
// A call of the front service's main interface; events are processed meanwhile, so the service may also live in
// the calling process.
QDBusMessage callService(
    const QDBusConnection &bus, const QString &member, const QVariantList &arguments = QVariantList());
// A property of a per-user object; invalid when the object or property is not there.
QVariant userProperty(const QDBusConnection &bus, uint uid, const QString &property);
QDBusMessage setEnableProperty(const QDBusConnection &bus, bool enable);
