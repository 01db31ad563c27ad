#pragma once

#include "domainconnection.h"
#include "fileversion.h"

#include <QByteArray>
#include <QDeadlineTimer>
#include <QJsonDocument>
#include <QJsonObject>
#include <QList>
#include <QNetworkReply>
#include <QObject>
#include <QSslConfiguration>
#include <QSslError>
#include <QString>

#include <atomic>
#include <functional>
#include <memory>

class GlobalSetting;
class ServerReachability;

// Client of the domain server: one synchronous JSON request per call over HTTP or HTTPS, with every
// address, path, certificate and time-out read from the settings file at the time of the call.
// One connection is kept alive between calls and rebuilt when the server or its TLS files change.
// Nothing here runs an event loop: every wait blocks the calling thread until its deadline.
class HttpHelper : public QObject
{
    Q_OBJECT
public:
    // Helpers that share a reachability see one outage: a failed connection stops the others from
    // waiting on the network until a probe sees the server again.
    explicit HttpHelper(std::shared_ptr<ServerReachability> reachability = nullptr, QObject *parent = nullptr);
    ~HttpHelper() override;

    // The fixed failure texts; callers compare results with them byte for byte.
    static const QString &refusedReply();
    static const QString &unreachableReply();
    static const QString &unknownAccountReply();

    // Blocking TCP probe of the domain server; a set cancel flag ends the wait early.
    bool checkServerAddress(QString &hostPort, const std::atomic<bool> *cancel = nullptr);
    // Caps the network time of everything up to the next call of this (checks and requests alike).
    void setCallDeadline(QDeadlineTimer deadline) { m_callDeadline = deadline; }
    // False (and one warning) when a server given by its address could not be verified at all.
    bool configureSsl(bool literalAddress, QSslConfiguration &configuration);
    DomainExchange sendRequest(const QString &url, const QByteArray &method, const QByteArray &body);
    int parseReply(const QString &url, const QByteArray &method, const DomainExchange &reply, QJsonDocument &document);
    bool checkReplyData(const QString &url, const QByteArray &method, const DomainExchange &reply, QJsonObject &object);
    QString readMachineId();
    // Whether the server answered the last request at all (an HTTP status came back), so that a caller can
    // tell a refusal from a connection lost half-way.
    bool lastRequestAnswered() const { return m_lastAnswered; }

    QString queryUserByName(const QString &name);
    QString queryUserByUid(uint uid);
    QString authenticate(const QString &username, const QString &password, const QString &method);
    QString queryGroupByName(const QString &name);
    QString queryGroupByGid(uint gid);
    QString resetPassword(uint uid, const QString &username, const QString &password, const QString &oldPassword);
    QString queryDomain();

    void onSslError(const QString &url, const DomainExchange &reply);
    void onReplyError(QNetworkReply::NetworkError error, const QString &url, const QString &detail);

private:
    using PathSetting = QString (GlobalSetting::*)() const;
    using BodyBuilder = std::function<QByteArray()>;

    struct Target {
        DomainEndpoint endpoint;
        QString hostPort;
    };

    bool resolveTarget(Target &target);
    // Builds the TLS configuration again when the files or the address form changed.
    void refreshTls(bool literalAddress);
    QDeadlineTimer requestDeadline(int milliseconds) const;
    bool exchange(
        PathSetting path, const QByteArray &method, const BodyBuilder &body, QJsonObject &object, QString &failure);
    QString call(PathSetting path, const QByteArray &method, const BodyBuilder &body);

    std::shared_ptr<ServerReachability> m_reachability;
    DomainConnection m_connection;
    // What the TLS configuration was built from: the three files as they were, and the address form.
    // Built again when any of it changes, or while a file has not settled.
    QStringList m_tlsPaths;
    QVector<FileVersion> m_tlsVersions;
    bool m_tlsLiteral = false;
    bool m_tlsSettled = false;
    quint64 m_tlsGeneration = 0;
    QSslConfiguration m_tlsConfiguration;
    bool m_tlsUsable = false;
    bool m_tlsOwnAuthorities = false;
    QString m_clientProblem; // why the client certificate or key cannot be used, naming the file; empty when it can
    bool m_lastAnswered = false;
    QDeadlineTimer m_callDeadline { QDeadlineTimer::Forever };
};
