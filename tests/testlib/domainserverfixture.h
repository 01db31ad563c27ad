#pragma once

#include <QByteArray>
#include <QJsonObject>
#include <QList>
#include <QProcess>
#include <QString>
#include <QTemporaryDir>
#include <QVariantMap>

// The test domain server (tools/test-domain-server) run as a child process on 127.0.0.2, with
// certificates made for this fixture alone. It owns a temporary directory holding the certificates,
// the users file, the behaviour file and the request log; the server is stopped on destruction.
//
//   DomainServerFixture server;            // certificates and defaultData() in place
//   QVERIFY2(server.start(), qPrintable(server.errorText()));
//   root.writeSettings(server.settingsIni({ { "main/enable", "true" } }));
//   ... server.requests() lists what the server received, oldest first.
class DomainServerFixture
{
public:
    DomainServerFixture();
    ~DomainServerFixture();
    DomainServerFixture(const DomainServerFixture &) = delete;
    DomainServerFixture &operator=(const DomainServerFixture &) = delete;

    // False when the certificates could not be made; errorText() says why.
    bool isValid() const;
    QString errorText() const;

    static QString address();
    // alice (10001, "alice-password") and bob (10002, "bob-password") in group kest (10000),
    // a group "staff" (10010) with alice, and the domain "kest.test".
    static QJsonObject defaultData();
    // Runs tools/make-test-certs.sh: ca.pem, server.pem/.key, client.pem/.key in directory.
    static bool makeCertificates(const QString &directory, QString *error = nullptr);

    // Port 0 lets the server pick a free one; port() tells which.
    bool start(quint16 port = 0);
    // Stops and starts again on the same port (with the current data, behaviour and mode).
    bool restart();
    void stop();
    bool isRunning() const;
    quint16 port() const;
    // Plain HTTP instead of HTTPS from the next start on.
    void setPlainHttp(bool plain);

    QString directory() const;
    QString caFile() const;
    QString clientCertificateFile() const;
    QString clientKeyFile() const;
    QString dataFile() const;

    bool setData(const QJsonObject &data);
    QJsonObject data() const;
    // Takes effect at the server's next request. An empty behaviour removes the path's entry.
    bool setMisbehaviour(const QString &path, const QString &behaviour);
    bool clearMisbehaviour();

    QList<QJsonObject> requests() const;
    bool clearRequests();

    // Settings file text that points the client at this server: ip, port, "network-timeout" 5 and
    // the client's certificate files. Overrides are "group/key" to a value; an invalid QVariant
    // removes the key.
    QByteArray settingsIni(const QVariantMap &overrides = QVariantMap()) const;

private:
    QString filePath(const QString &name) const;
    bool writeJson(const QString &name, const QJsonObject &object) const;
    QJsonObject readJson(const QString &name) const;
    bool waitForListening();

    QTemporaryDir m_dir;
    QProcess m_server;
    QString m_error;
    quint16 m_port = 0;
    bool m_plain = false;
    bool m_valid = false;
};
