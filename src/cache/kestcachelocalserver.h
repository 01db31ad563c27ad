#pragma once

#include <QJsonObject>
#include <QTcpServer>

#include <memory>

class KestCacheService;
class QTcpSocket;

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

private Q_SLOTS:
    void onNewConnection();
    void onAcceptError(QAbstractSocket::SocketError error);
    void onReadyRead();
    void onDisconnected();

private:
    void handleRequest(QTcpSocket *socket, const QByteArray &payload);
    void writeReply(QTcpSocket *socket, const QByteArray &framed);
    void watchPartialFrame(QTcpSocket *socket);
    void sendErrorReply(QTcpSocket *socket, const QString &text);
    QString sendResultReply(QTcpSocket *socket, int retVal, const QString &text);
    QString sendStatusReply(QTcpSocket *socket, int code, const QString &text);
    QString dispatchFunctionCall(QTcpSocket *socket, const QJsonObject &request);
    QString callService(const QString &name, const QStringList &arguments);
    void handleServerCommand(QTcpSocket *socket, const QJsonObject &request);
    bool isRootPeer(QTcpSocket *socket, int command);
    QString cleanCache(QTcpSocket *socket, const QJsonValue &data);
    QString cleanCacheNotInList(QTcpSocket *socket, const QJsonValue &data);
    QString updateCache(QTcpSocket *socket, const QJsonValue &data);
    QString passwordConfig(QTcpSocket *socket, const QJsonValue &data);
    QString modifyUserPassword(QTcpSocket *socket, const QJsonValue &data);

    std::unique_ptr<KestCacheService> m_service;
};
