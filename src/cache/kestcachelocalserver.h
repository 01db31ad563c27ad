#pragma once

#include <QJsonObject>
#include <QList>
#include <QTcpServer>

#include <memory>

class KestCacheService;
class LocalConnection;

// The cache daemon's request server: one length-prefixed JSON request per read, one framed reply.
class KestCacheLocalServer : public QTcpServer
{
    Q_OBJECT

public:
    // Takes ownership of the service.
    explicit KestCacheLocalServer(KestCacheService *service, QObject *parent = nullptr);
    ~KestCacheLocalServer() override;

    static QByteArray frame(const QByteArray &payload);

    static const quint32 maximumFrameLength = 1024 * 1024;
    static const int partialFrameTimeoutMs = 30000;

protected:
    // Each connection is served on its own descriptor (LocalConnection), not through a QTcpSocket.
    void incomingConnection(qintptr descriptor) override;

private Q_SLOTS:
    void onNewConnection();
    void onAcceptError(QAbstractSocket::SocketError error);
    void onReadyRead();
    void onDisconnected();

private:
    void handleRequest(LocalConnection *socket, const QByteArray &payload);
    void writeReply(LocalConnection *socket, const QByteArray &framed);
    void sendErrorReply(LocalConnection *socket, const QString &text);
    QString sendResultReply(LocalConnection *socket, int retVal, const QString &text);
    QString sendStatusReply(LocalConnection *socket, int code, const QString &text);
    QString dispatchFunctionCall(LocalConnection *socket, const QJsonObject &request);
    QString callService(const QString &name, const QStringList &arguments);
    void handleServerCommand(LocalConnection *socket, const QJsonObject &request);
    static qint64 peerUid(LocalConnection *socket);
    bool isRootPeer(LocalConnection *socket, int command);
    // Password checks and changes are answered for root and for the account itself only.
    bool isPasswordPeer(LocalConnection *socket, const QString &account);
    static QString accountOfChange(const QString &json);
    QString cleanCache(LocalConnection *socket, const QJsonValue &data);
    QString cleanCacheNotInList(LocalConnection *socket, const QJsonValue &data);
    QString updateCache(LocalConnection *socket, const QJsonValue &data);
    QString passwordConfig(LocalConnection *socket, const QJsonValue &data);
    QString modifyUserPassword(LocalConnection *socket, const QJsonValue &data);
    void sendStatus(LocalConnection *socket, const QJsonValue &data);

    std::unique_ptr<KestCacheService> m_service;
    QList<LocalConnection *> m_pending;
};
