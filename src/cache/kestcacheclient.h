#pragma once

#include <QAbstractSocket>
#include <QJsonObject>
#include <QObject>

class QTcpSocket;
class QTextStream;

// Command-line side of the cache daemon: one server command, one reply.
class KestCacheClient : public QObject
{
    Q_OBJECT

public:
    explicit KestCacheClient(QObject *parent = nullptr);

    bool connectToServer(const QString &address, quint16 port);
    // Writes the request for commands 1, 2, 3 and 5 and returns its text; any other number sends
    // nothing and returns the "invalid command" reply.
    QString sendCommand(int command, const QByteArray &argument);
    // Command 6: prints a user's cache record from the local store.
    static bool showCache(const QByteArray &argument, QTextStream &out, QTextStream &err);
    static QString resultReply(int retVal, const QString &message);
    // Whether the daemon's reply reports a failure, whichever of its reply shapes it has.
    static bool isErrorReply(const QJsonObject &reply);

    // The daemon's state (and the accounts the caller may see) instead of a change.
    static const int statusCommand = 7;

    static const int connectTimeoutMs = 30000;

Q_SIGNALS:
    // A whole reply frame arrived; isJson tells whether it holds a JSON object.
    void replyReceived(const QByteArray &payload, bool isJson);

private Q_SLOTS:
    void onConnected();
    void onReadyRead();
    void onDisconnected();
    void onStateChanged(QAbstractSocket::SocketState state);
    void onError(QAbstractSocket::SocketError error);

private:
    QTcpSocket *m_socket;
};
