#pragma once

#include <QByteArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QList>
#include <QNetworkReply>
#include <QObject>
#include <QSslError>
#include <QString>

#include <functional>

class GlobalSetting;
class QNetworkRequest;

// Client of the domain server: one synchronous JSON request per call over HTTP or HTTPS, with every
// address, path, certificate and time-out read from the settings file at the time of the call.
//
// Ownership: sendRequest makes a QNetworkAccessManager for each request and hands it to the reply it
// returns, so deleting the reply (delete or deleteLater) releases both. The reply is the caller's.
// The REST operations dispose of their replies themselves and return JSON text only.
class HttpHelper : public QObject
{
    Q_OBJECT
public:
    explicit HttpHelper(QObject *parent = nullptr);

    // The fixed failure texts; callers compare results with them byte for byte.
    static const QString &refusedReply();
    static const QString &unreachableReply();
    static const QString &unknownAccountReply();

    // Blocking TCP probe of the domain server; safe on a thread without an event loop.
    bool checkServerAddress(QString &hostPort);
    void configureSsl(QNetworkRequest &request);
    // With wait set the calling thread runs a local event loop until the reply has finished
    // (or was aborted by the time-out); without it the caller's own event loop must run.
    QNetworkReply *sendRequest(const QString &url, const QByteArray &method, const QByteArray &body, bool wait);
    int parseReply(QNetworkReply *reply, QJsonDocument &document);
    bool checkReplyData(QNetworkReply *reply, QJsonObject &object);
    QString readMachineId();

    QString queryUserByName(const QString &name);
    QString queryUserByUid(uint uid);
    QString authenticate(const QString &username, const QString &password, const QString &method);
    QString queryGroupByName(const QString &name);
    QString queryGroupByGid(uint gid);
    QString resetPassword(uint uid, const QString &username, const QString &password, const QString &oldPassword);
    QString queryDomain();

public Q_SLOTS:
    void onSslError(QNetworkReply *reply, const QList<QSslError> &errors);
    void onReplyError(QNetworkReply::NetworkError error);

private:
    using PathSetting = QString (GlobalSetting::*)() const;
    using BodyBuilder = std::function<QByteArray()>;

    bool exchange(
        PathSetting path, const QByteArray &method, const BodyBuilder &body, QJsonObject &object, QString &failure);
    QString call(PathSetting path, const QByteArray &method, const BodyBuilder &body);
};
