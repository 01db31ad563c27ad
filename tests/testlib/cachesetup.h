#pragma once

#include "cachedaemonfixture.h"
#include "domainserverfixture.h"
#include "testroot.h"

#include <QVariantMap>

// cache-kest in a fresh test root beside a running test domain server, offline logins allowed for a day.
class CacheSetup
{
public:
    TestRoot root;
    DomainServerFixture server;
    CacheDaemonFixture daemon;

    // The server's settings with "enable" on, "network-timeout" 2 and offline logins, then the overrides.
    bool writeSettings(const QVariantMap &overrides = {}) const;
    // Starts the server, writes the settings and starts the daemon; errorText() says what failed.
    bool start(const QVariantMap &overrides = {});
    QString errorText() const { return server.errorText() + daemon.errorText(); }
    bool hasRecord(uint uid) const;

    QByteArray lookUp(const QString &name) const;
    QByteArray login(const QString &name, const QString &password) const;
};
