#include "kestcachelocalserver.h"

#include "cachestore.h"
#include "heldloglines.h"
#include "kestcacheservice.h"
#include "kestpaths.h"
#include "localconnection.h"
#include "passwordpolicy.h"
#include "peeruid.h"
#include "settingsfile.h"
#include "settingsupdate.h"
#include "statusreport.h"
#include "userlistmanager.h"

#include <QDebug>
#include <QFile>
#include <QJsonArray>
#include <QJsonDocument>
#include <QSettings>
#include <QtEndian>

namespace
{
const int errorReplyVersion = 16777216;

struct FunctionSpec {
    const char *name;
    int argumentCount;
    // The service writes its own replies compact; only a password change passes on the server's text.
    bool compactResult;
};
const FunctionSpec functions[] = {
    { "queryAccountName", 1, true },
    { "queryUid", 1, true },
    { "queryGroupName", 2, true },
    { "queryGid", 2, true },
    { "authenticatePassword", 2, true },
    { "modifyUser", 1, false },
    { "getAccountByName", 1, true },
    { "getAccountByUid", 1, true },
    { "listAccounts", 0, true },
};

QString compact(const QJsonObject &object)
{
    return QString::fromUtf8(QJsonDocument(object).toJson(QJsonDocument::Compact));
}
} // namespace

KestCacheLocalServer::KestCacheLocalServer(KestCacheService *service, QObject *parent)
    : QTcpServer(parent)
    , m_service(service)
{
    connect(this, &QTcpServer::newConnection, this, &KestCacheLocalServer::onNewConnection);
    connect(this, &QTcpServer::acceptError, this, &KestCacheLocalServer::onAcceptError);
}

KestCacheLocalServer::~KestCacheLocalServer() = default;

QByteArray KestCacheLocalServer::frame(const QByteArray &payload)
{
    QByteArray framed(4, '\0');
    qToBigEndian<quint32>(quint32(payload.size()), framed.data());
    return framed + payload;
}

void KestCacheLocalServer::incomingConnection(qintptr descriptor)
{
    m_pending.append(new LocalConnection(int(descriptor), this));
}

void KestCacheLocalServer::onNewConnection()
{
    while (!m_pending.isEmpty()) {
        LocalConnection *socket = m_pending.takeFirst();
        connect(socket, &LocalConnection::readyRead, this, &KestCacheLocalServer::onReadyRead);
        connect(socket, &LocalConnection::disconnected, this, &KestCacheLocalServer::onDisconnected);
        // A client sends its request right after connecting: it is usually here already.
        socket->receive();
    }
}

void KestCacheLocalServer::onAcceptError(QAbstractSocket::SocketError error)
{
    qWarning().noquote() << QStringLiteral("onAcceptError : ") + QString::number(int(error));
}

void KestCacheLocalServer::onDisconnected()
{
    if (auto *socket = qobject_cast<LocalConnection *>(sender()))
        socket->deleteLater();
}

// The domain client blocks without running an event loop, so no other request is taken up and no
// socket is deleted while one is answered: requests are served one at a time, in the order read.
void KestCacheLocalServer::onReadyRead()
{
    auto *socket = qobject_cast<LocalConnection *>(sender());
    if (!socket)
        return;
    // Strictly more than the length prefix: an empty frame waits for further bytes.
    if (socket->bytesAvailable() <= 4) {
        socket->watchPendingBytes(partialFrameTimeoutMs);
        return;
    }
    const QByteArray prefix = socket->peek(4);
    const quint32 length = qFromBigEndian<quint32>(prefix.constData());
    if (length > maximumFrameLength) {
        sendErrorReply(socket, QStringLiteral("Frame too large !!!"));
        socket->disconnectFromHost();
        return;
    }
    if (quint64(length) + 4 > quint64(socket->bytesAvailable())) {
        socket->watchPendingBytes(partialFrameTimeoutMs);
        return;
    }
    socket->read(4);
    const QByteArray payload = socket->read(length);
    handleRequest(socket, payload);
    socket->watchPendingBytes(partialFrameTimeoutMs);
}

void KestCacheLocalServer::handleRequest(LocalConnection *socket, const QByteArray &payload)
{
    const HeldLogLines logAfterReply;
    const SettingsFile::OneLook settingsOnce;
    QJsonParseError error;
    const QJsonDocument document = QJsonDocument::fromJson(payload, &error);
    if (error.error != QJsonParseError::NoError || !document.isObject()) {
        qWarning().noquote() << QStringLiteral("Error in JSON data !!!");
        sendErrorReply(socket, QStringLiteral("Error in JSON data !!!"));
        return;
    }
    const QJsonObject request = document.object();
    if (request.contains(QLatin1String("command")))
        handleServerCommand(socket, request);
    else
        dispatchFunctionCall(socket, request);
}

// The service may have waited on the domain server long enough for the peer to give up.
void KestCacheLocalServer::writeReply(LocalConnection *socket, const QByteArray &framed)
{
    if (socket->peerHasLeft()) {
        const QString reason = socket->errorString().isEmpty() ? QStringLiteral("The remote host closed the connection")
                                                               : socket->errorString();
        qWarning().noquote() << QStringLiteral("socket error: ") + reason;
        return;
    }
    socket->write(framed);
}

void KestCacheLocalServer::sendErrorReply(LocalConnection *socket, const QString &text)
{
    const QJsonObject reply { { QStringLiteral("version"), errorReplyVersion }, { QStringLiteral("errorInfo"), text } };
    socket->write(frame(QJsonDocument(reply).toJson(QJsonDocument::Compact)));
}

QString KestCacheLocalServer::sendResultReply(LocalConnection *socket, int retVal, const QString &text)
{
    const QString reply = compact({ { QStringLiteral("retVal"), retVal }, { QStringLiteral("errorMessage"), text } });
    socket->write(frame(reply.toUtf8()));
    return reply;
}

QString KestCacheLocalServer::sendStatusReply(LocalConnection *socket, int code, const QString &text)
{
    const QString reply = compact({ { QStringLiteral("code"), code }, { QStringLiteral("msg"), text },
        { QStringLiteral("data"), QJsonValue::Null } });
    socket->write(frame(reply.toUtf8()));
    return reply;
}

QString KestCacheLocalServer::dispatchFunctionCall(LocalConnection *socket, const QJsonObject &request)
{
    if (!request.contains(QLatin1String("functionName")) || !request.contains(QLatin1String("argv"))
        || !request.contains(QLatin1String("version"))) {
        sendErrorReply(
            socket, QStringLiteral("The JSON field is missing. version, functionName and argv are required !!!"));
        return QString();
    }
    const QString name = request.value(QLatin1String("functionName")).toString();
    const QJsonArray argv = request.value(QLatin1String("argv")).toArray();
    for (const FunctionSpec &function : functions) {
        if (name != QLatin1String(function.name))
            continue;
        if (argv.size() != function.argumentCount) {
            sendErrorReply(socket, QStringLiteral("Error in JSON argv array (all array members must be strings) !!!"));
            return QString();
        }
        QStringList arguments;
        for (const QJsonValue &argument : argv)
            arguments.append(argument.toString());
        if (name == QLatin1String("authenticatePassword") && !isPasswordPeer(socket, arguments.at(0))) {
            writeReply(socket, frame(KestCacheService::passReply(false).toUtf8()));
            return QString();
        }
        if (name == QLatin1String("modifyUser") && !isPasswordPeer(socket, accountOfChange(arguments.at(0)))) {
            sendStatusReply(socket, 1, QStringLiteral("permission denied !!!"));
            return QString();
        }
        const QString result = callService(name, arguments);
        const QByteArray payload = function.compactResult
            ? result.toUtf8()
            : QJsonDocument::fromJson(result.toUtf8()).toJson(QJsonDocument::Compact);
        writeReply(socket, frame(payload));
        return result;
    }
    sendErrorReply(socket, QStringLiteral("Function name not defined !!!"));
    return QString();
}

QString KestCacheLocalServer::callService(const QString &name, const QStringList &arguments)
{
    if (name == QLatin1String("queryAccountName"))
        return m_service->queryAccountName(arguments.at(0));
    if (name == QLatin1String("queryUid"))
        return m_service->queryUid(arguments.at(0).toUInt());
    if (name == QLatin1String("queryGroupName"))
        return m_service->queryGroupName(arguments.at(0), arguments.at(1));
    if (name == QLatin1String("queryGid"))
        return m_service->queryGid(arguments.at(0).toUInt(), arguments.at(1));
    if (name == QLatin1String("authenticatePassword"))
        return m_service->authenticatePassword(arguments.at(0), arguments.at(1));
    if (name == QLatin1String("modifyUser"))
        return m_service->modifyUser(arguments.at(0));
    if (name == QLatin1String("getAccountByName"))
        return m_service->getAccountByName(arguments.at(0));
    if (name == QLatin1String("getAccountByUid"))
        return m_service->getAccountByUid(arguments.at(0).toUInt());
    if (name == QLatin1String("listAccounts"))
        return m_service->listAccounts();
    return QString();
}

void KestCacheLocalServer::handleServerCommand(LocalConnection *socket, const QJsonObject &request)
{
    if (!request.contains(QLatin1String("command")) || !request.contains(QLatin1String("data"))) {
        sendResultReply(socket, 1, QStringLiteral("The JSON field is missing. command and data are required !!!"));
        return;
    }
    const QJsonValue data = request.value(QLatin1String("data"));
    const int command = request.value(QLatin1String("command")).toInt();
    if (command >= 1 && command <= 4 && !isRootPeer(socket, command))
        return;
    switch (command) {
    case 1:
        qDebug().noquote() << QStringLiteral("---------------ServerCommand::CleanCache");
        cleanCache(socket, data);
        return;
    case 2:
        qDebug().noquote() << QStringLiteral("---------------CleanCacheNotInList");
        cleanCacheNotInList(socket, data);
        return;
    case 3:
        qDebug().noquote() << QStringLiteral("---------------ServerCommand::UpdateCache");
        updateCache(socket, data);
        return;
    case 4:
        qDebug().noquote() << QStringLiteral("---------------ServerCommand::PasswordConfig");
        passwordConfig(socket, data);
        return;
    case 5:
        qDebug().noquote() << QStringLiteral("---------------ServerCommand::ModifyUserPasswd");
        modifyUserPassword(socket, data);
        return;
    case 7:
        sendStatus(socket, data);
        return;
    default:
        sendResultReply(socket, 1, QStringLiteral("invalid command!!!"));
    }
}

// The uid owning the client's end of the connection, or -1 when the kernel does not tell.
qint64 KestCacheLocalServer::peerUid(LocalConnection *socket)
{
    uid_t uid = 0;
    quint16 peerPort = 0, localPort = 0;
    const QHostAddress peer = socket->peerAddress(peerPort), local = socket->localAddress(localPort);
    return PeerUid::lookup(peer, peerPort, local, localPort, uid) ? qint64(uid) : -1;
}

// Deleting caches and rewriting the policy are root's alone; whoever cannot be identified is refused.
bool KestCacheLocalServer::isRootPeer(LocalConnection *socket, int command)
{
    const qint64 uid = peerUid(socket);
    if (uid == 0)
        return true;
    qWarning().noquote() << QStringLiteral("refused server command %1 from uid %2.").arg(command).arg(uid);
    sendResultReply(socket, 1, QStringLiteral("permission denied !!!"));
    return false;
}

bool KestCacheLocalServer::isPasswordPeer(LocalConnection *socket, const QString &account)
{
    const qint64 uid = peerUid(socket);
    if (uid == 0 || (uid > 0 && uid == qint64(m_service->userList()->uidOfName(account))))
        return true;
    qWarning().noquote() << QStringLiteral("refused password check of %1 from uid %2.").arg(account).arg(uid);
    return false;
}

QString KestCacheLocalServer::accountOfChange(const QString &json)
{
    return QJsonDocument::fromJson(json.toUtf8()).object().value(QLatin1String("username")).toString();
}

QString KestCacheLocalServer::cleanCache(LocalConnection *socket, const QJsonValue &data)
{
    const QString path = cacheFilePathOfUid(data.toString().toUInt());
    if (!QFile::exists(path))
        return sendResultReply(socket, 1, QStringLiteral("[CleanCache] : cache file not exists!!!"));
    QFile::remove(path);
    return sendResultReply(socket, 0, QString());
}

QString KestCacheLocalServer::cleanCacheNotInList(LocalConnection *socket, const QJsonValue &data)
{
    QJsonParseError error;
    const QJsonDocument document = QJsonDocument::fromJson(data.toString().toUtf8(), &error);
    if (error.error != QJsonParseError::NoError)
        return sendResultReply(socket, 1, QStringLiteral("[CleanCacheNotInList] : json parse error!!!"));
    const QJsonArray whitelist = document.object().value(QLatin1String("whitelist")).toArray();
    const QList<quint32> uids = listCacheUids();
    for (const quint32 uid : uids) {
        // Only numbers match: an id written as a JSON string does not keep its file.
        const bool kept = std::any_of(whitelist.begin(), whitelist.end(),
            [uid](const QJsonValue &value) { return value.isDouble() && value.toDouble() == double(uid); });
        const QString path = cacheFilePathOfUid(uid);
        if (!kept && QFile::exists(path))
            QFile::remove(path);
    }
    return sendResultReply(socket, 0, QString());
}

QString KestCacheLocalServer::updateCache(LocalConnection *socket, const QJsonValue &data)
{
    const quint32 uid = quint32(data.toInt());
    if (!QFile::exists(cacheFilePathOfUid(uid)))
        return sendResultReply(socket, 1, QStringLiteral("[UpdateCache] : cache file not exists!!!"));
    if (!refreshCacheRecord(uid))
        return sendResultReply(socket, 1, QStringLiteral("[UpdateCache] : cache file not written!!!"));
    return sendResultReply(socket, 0, QString());
}

QString KestCacheLocalServer::passwordConfig(LocalConnection *socket, const QJsonValue &data)
{
    QJsonParseError error;
    const QJsonDocument document = QJsonDocument::fromJson(data.toString().toUtf8(), &error);
    if (error.error != QJsonParseError::NoError)
        return sendResultReply(socket, 1, QStringLiteral("[PasswordConfig] : pw-config json parse error!!!"));
    const QJsonObject policy = document.object();
    for (const char *group : PasswordPolicy::groupNames) {
        if (!policy.contains(QLatin1String(group)))
            return sendResultReply(socket, 1,
                QStringLiteral("[PasswordConfig] : pw-config json missing field,[pw_strength "
                               "pw_validity pw_history_check first_login offline_login]"));
    }
    if (!SettingsUpdate::apply([&policy](QSettings &settings) { PasswordPolicy::write(settings, policy); }))
        return sendResultReply(socket, 1, QStringLiteral("[PasswordConfig] : cannot write settings file!!!"));
    return sendResultReply(socket, 0, QString());
}

QString KestCacheLocalServer::modifyUserPassword(LocalConnection *socket, const QJsonValue &data)
{
    const QString text = data.toString();
    QJsonParseError error;
    const QJsonDocument document = QJsonDocument::fromJson(text.toUtf8(), &error);
    if (error.error != QJsonParseError::NoError)
        return sendStatusReply(socket, 1, QStringLiteral("json格式解析错误"));
    const QJsonObject request = document.object();
    if (!request.contains(QLatin1String("username")) || !request.contains(QLatin1String("password"))
        || !request.contains(QLatin1String("old_password")))
        return sendStatusReply(socket, 2, QStringLiteral("请求消息缺少必要的字段,username,password,old_password"));
    if (!isPasswordPeer(socket, accountOfChange(text)))
        return sendStatusReply(socket, 1, QStringLiteral("permission denied !!!"));
    const QString reply = m_service->modifyUser(text);
    writeReply(socket, frame(reply.toUtf8()));
    return reply;
}

// Open to every local user: the general state for anyone, an account's part for root and the account itself.
void KestCacheLocalServer::sendStatus(LocalConnection *socket, const QJsonValue &data)
{
    const QJsonObject status = StatusReport::build(*m_service, peerUid(socket), data.toString().trimmed());
    socket->write(frame(QJsonDocument(status).toJson(QJsonDocument::Compact)));
}
