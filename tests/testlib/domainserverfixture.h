#pragma once

#include <QByteArray>
#include <QJsonObject>
#include <QList>
#include <QProcess>
#include <QString>
#include <QTemporaryDir>
#include <QVariantMap>

// The test domain server (tools/test-domain-server) as a child process on 127.0.0.2, with certificates,
// data, behaviour and request log of its own in a temporary directory; stopped on destruction.
class DomainServerFixture
{
public:
    DomainServerFixture();
    ~DomainServerFixture() { stop(); }
    DomainServerFixture(const DomainServerFixture &) = delete;
    DomainServerFixture &operator=(const DomainServerFixture &) = delete;

    // False when the certificates could not be made; errorText() says why.
    bool isValid() const { return m_valid; }
    // A file of its directory: certificates, keys, data.
    QString filePath(const QString &name) const { return m_dir.filePath(name); }
    QString errorText() const { return m_error; }

    static QString address() { return QStringLiteral("127.0.0.2"); }
    // Where the next start listens (a loopback address; address() unless told otherwise).
    void setListenAddress(const QString &listen) { m_listen = listen; }
    // alice (10001, "alice-password", sudo) and bob (10002, "bob-password") in group kest (10000),
    // a group "staff" (10010) with alice, and the domain "kest.test".
    static QJsonObject defaultData();
    // ca.pem, server.pem/.key and client.pem/.key in directory.
    static bool makeCertificates(const QString &directory, QString *error = nullptr);

    // Port 0 lets the server pick a free one; port() tells which. plain: HTTP instead of HTTPS.
    // certificate: which of makeCertificates' server certificates it shows ("server", "selfsigned", ...).
    bool start(quint16 port = 0, bool plain = false, const QString &certificate = QStringLiteral("server"));
    void stop();
    quint16 port() const { return m_port; }

    bool setData(const QJsonObject &data) { return writeJson(QStringLiteral("data.json"), data); }
    // Takes effect at the server's next request; an empty behaviour removes the path's entry.
    bool setMisbehaviour(const QString &path, const QString &behaviour);
    bool clearMisbehaviour() { return writeJson(QStringLiteral("behaviour.json"), QJsonObject()); }

    // What the server received, oldest first.
    QList<QJsonObject> requests() const;
    bool clearRequests();

    // Settings that point the client at this server with its certificate files and "network-timeout" 5.
    // Overrides are "group/key" to a value; an invalid QVariant removes the key.
    QByteArray settingsIni(const QVariantMap &overrides = QVariantMap()) const;

private:
    QString pathOf(const char *name) const { return m_dir.filePath(QLatin1String(name)); }
    bool writeJson(const QString &name, const QJsonObject &object) const;

    QTemporaryDir m_dir;
    QProcess m_server;
    QString m_error;
    quint16 m_port = 0;
    QString m_listen = address();
    bool m_valid = false;
};
