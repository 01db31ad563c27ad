#include "kestcacheclient.h"

#include "cachecontrolfactory.h"
#include "cachestore.h"
#include "kestcachelocalserver.h"

#include <QJsonDocument>
#include <QJsonObject>
#include <QTcpSocket>
#include <QTextStream>
#include <QtEndian>

KestCacheClient::KestCacheClient(QObject *parent)
    : QObject(parent)
    , m_socket(new QTcpSocket(this))
{
    connect(m_socket, &QTcpSocket::connected, this, &KestCacheClient::onConnected);
    connect(m_socket, &QTcpSocket::readyRead, this, &KestCacheClient::onReadyRead);
    connect(m_socket, &QTcpSocket::disconnected, this, &KestCacheClient::onDisconnected);
    connect(m_socket, &QTcpSocket::stateChanged, this, &KestCacheClient::onStateChanged);
    connect(m_socket, &QTcpSocket::errorOccurred, this, &KestCacheClient::onError);
}

bool KestCacheClient::connectToServer(const QString &address, quint16 port)
{
    m_socket->connectToHost(address, port, QIODevice::ReadWrite, QAbstractSocket::AnyIPProtocol);
    return m_socket->waitForConnected(connectTimeoutMs);
}

QString KestCacheClient::resultReply(int retVal, const QString &message)
{
    const QJsonObject reply { { QStringLiteral("retVal"), retVal }, { QStringLiteral("errorMessage"), message } };
    return QString::fromUtf8(QJsonDocument(reply).toJson(QJsonDocument::Indented));
}

QString KestCacheClient::sendCommand(int command, const QByteArray &argument)
{
    if (command != 1 && command != 2 && command != 3 && command != 5 && command != statusCommand)
        return resultReply(1, QStringLiteral("invalid command"));
    // Every argument travels as a JSON string, even where the server reads a number.
    const QJsonObject request { { QStringLiteral("command"), command },
        { QStringLiteral("data"), QString::fromUtf8(argument) } };
    const QByteArray text = QJsonDocument(request).toJson(QJsonDocument::Compact);
    m_socket->write(KestCacheLocalServer::frame(text));
    m_socket->flush();
    return QString::fromUtf8(text);
}

bool KestCacheClient::isErrorReply(const QJsonObject &reply)
{
    return reply.contains(QLatin1String("errorInfo")) || reply.value(QLatin1String("retVal")).toInt() != 0
        || reply.value(QLatin1String("code")).toInt() != 0;
}

bool KestCacheClient::showCache(const QByteArray &argument, QTextStream &out, QTextStream &err)
{
    CacheControlPtr record = createCacheControl();
    record->setUid(argument.toUInt());
    if (!loadCacheRecord(record) || !record) {
        err << "read cache file failed!!!" << Qt::endl;
        return false;
    }
    out << "uid: " << record->uid() << Qt::endl
        << "gid: " << record->mainGid() << Qt::endl
        << "account: " << record->account() << Qt::endl
        << "directory: " << record->homePath() << Qt::endl
        << "shell: " << record->loginShell() << Qt::endl
        << "gecos: " << record->gecos() << Qt::endl;
    return true;
}

void KestCacheClient::onReadyRead()
{
    if (m_socket->bytesAvailable() <= 4)
        return;
    const quint32 length = qFromBigEndian<quint32>(m_socket->peek(4).constData());
    if (quint64(length) + 4 > quint64(m_socket->bytesAvailable()))
        return;
    m_socket->read(4);
    const QByteArray payload = m_socket->read(length);
    Q_EMIT replyReceived(payload, QJsonDocument::fromJson(payload).isObject());
}

void KestCacheClient::onConnected() { }

void KestCacheClient::onDisconnected() { }

void KestCacheClient::onStateChanged(QAbstractSocket::SocketState state)
{
    Q_UNUSED(state)
}

void KestCacheClient::onError(QAbstractSocket::SocketError error)
{
    Q_UNUSED(error)
}
