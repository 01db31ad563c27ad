#include "dbuskestservice.h"

#include "cachecontrolfactory.h"
#include "cachestore.h"
#include "dbuskestserviceuser.h"
#include "globalsetting.h"
#include "grouplistmanager.h"
#include "kestpaths.h"
#include "passwordpolicy.h"
#include "settingsupdate.h"
#include "userlistmanager.h"

#include <QDBusConnectionInterface>
#include <QDBusInterface>
#include <QDBusMessage>
#include <QDBusReply>
#include <QDBusVariant>
#include <QDebug>
#include <QFile>
#include <QJsonDocument>
#include <QJsonObject>
#include <QProcess>
#include <QSettings>

#include <algorithm>
#include <functional>

namespace
{
const uint kFirstDomainUid = 10000;
const int kLogindTimeoutMs = 5000;
const int kDeleteUserTimeoutMs = 5000;
const int kChildProcessTimeoutMs = 30000;

const QString kLogindService = QStringLiteral("org.freedesktop.login1");
const QString kLogindPath = QStringLiteral("/org/freedesktop/login1");
const QString kLogindManager = QStringLiteral("org.freedesktop.login1.Manager");
const QString kUserObjectPath = QStringLiteral("/com/nimbal/kest/iam/user");
const char kSyncTag[] = "syncLightDM";

QString errorText(const QDBusError &error)
{
    return error.name() + QStringLiteral(", detail: ") + error.message();
}

// Output of a finished child; a child still running is killed so that the service never leaves one behind.
QByteArray runChild(const QString &program, const QStringList &arguments, QByteArray *errorOutput = nullptr,
    const QByteArray &input = QByteArray())
{
    QProcess process;
    process.start(program, arguments, QIODevice::ReadWrite);
    if (!input.isEmpty() && process.waitForStarted(kChildProcessTimeoutMs)) {
        process.write(input);
        process.closeWriteChannel();
    }
    process.waitForFinished(kChildProcessTimeoutMs);
    const QByteArray output = process.readAllStandardOutput();
    if (errorOutput)
        *errorOutput = process.readAllStandardError();
    if (process.state() != QProcess::NotRunning) {
        process.kill();
        process.waitForFinished(kChildProcessTimeoutMs);
    }
    return output;
}
} // namespace

DBusKestService::DBusKestService(const QDBusConnection &connection, QObject *parent)
    : QObject(parent)
    , m_connection(connection)
{
    registerKestDBusTypes();
    if (isEnabled())
        watchLoginSessions();
    else
        cleanDomainUserCacheFiles();
}

DBusKestService::~DBusKestService()
{
    clearUserObjects();
}

void DBusKestService::watchLoginSessions()
{
    m_loginManager = new QDBusInterface(kLogindService, kLogindPath, kLogindManager, m_connection, this);
    connect(
        m_loginManager, SIGNAL(SessionNew(QString, QDBusObjectPath)), this, SLOT(SessionNew(QString, QDBusObjectPath)));
}

bool DBusKestService::isEnabled() const
{
    const QString settingsFile = KestPaths::settingsFile();
    if (!QFile::exists(settingsFile)) {
        qCritical().noquote() << QStringLiteral("critical error. cannot read configuration file ") + settingsFile;
        return false;
    }
    return GlobalSetting::instance()->isEnabled();
}

void DBusKestService::setEnable(bool enable)
{
    const QString settingsFile = KestPaths::settingsFile();
    if (!QFile::exists(settingsFile)) {
        qCritical().noquote() << QStringLiteral("critical error. cannot read configuration file ") + settingsFile;
        return;
    }
    if (enable == isEnabled()) {
        qWarning().noquote() << QStringLiteral("already in destination status.");
        return;
    }
    if (!writeEnableSetting(enable))
        return;
    if (enable) {
        // Only the cache is emptied: the session watch stays as it was at start.
        cleanDomainUserCacheFiles();
        return;
    }
    deleteDomainUsersDesktopData();
    switchToGreeter();
}

bool DBusKestService::writeEnableSetting(bool enable) const
{
    return SettingsUpdate::apply([enable](QSettings &settings) {
        settings.beginGroup(QStringLiteral("main"));
        settings.setValue(QStringLiteral("enable"), enable);
        settings.endGroup();
    });
}

void DBusKestService::deleteDomainUsersDesktopData()
{
    GroupListManager groups;
    const UserListManager users(&groups);
    UidList uids;
    const QList<UserEntryPtr> entries = users.users();
    for (const UserEntryPtr &entry : entries) {
        if (entry->uid >= kFirstDomainUid && !uids.contains(entry->uid))
            uids.append(entry->uid);
    }
    for (const uint uid : qAsConst(uids)) {
        const UserEntryPtr entry = users.entryOfUid(uid);
        if (!entry) {
            qWarning().noquote() << QStringLiteral("invalid account information");
            continue;
        }
        deleteUserDesktopData(entry->name);
    }
}

void DBusKestService::deleteUserDesktopData(const QString &userName)
{
    QDBusMessage call = QDBusMessage::createMethodCall(QStringLiteral("com.nimbal.daemon.Accounts"),
        QStringLiteral("/com/nimbal/daemon/Accounts"), QStringLiteral("com.nimbal.daemon.Accounts"),
        QStringLiteral("DeleteUser"));
    call << userName << true;
    const QDBusMessage reply = m_connection.call(call, QDBus::Block, kDeleteUserTimeoutMs);
    if (reply.type() != QDBusMessage::ReplyMessage)
        qWarning().noquote() << QStringLiteral("delete user data failed. error: ") + reply.errorMessage();
}

void DBusKestService::switchToGreeter()
{
    const QJsonObject target { { QStringLiteral("Type"), 0 }, { QStringLiteral("Uid"), 0 } };
    QDBusMessage call = QDBusMessage::createMethodCall(QStringLiteral("com.nimbal.ose.LockService"),
        QStringLiteral("/com/nimbal/ose/LockService"), QStringLiteral("com.nimbal.ose.LockService"),
        QStringLiteral("SwitchToUser"));
    call << QString::fromUtf8(QJsonDocument(target).toJson(QJsonDocument::Compact));
    const QDBusMessage reply = m_connection.call(call, QDBus::Block);
    if (reply.type() != QDBusMessage::ReplyMessage)
        qWarning().noquote() << QStringLiteral("call ose-lockservice failed.");
}

bool DBusKestService::registerUserObjects(QDBusConnection connection)
{
    const UidList uids = GetUserIdList();
    if (uids.isEmpty())
        return true;
    // One user list, read once from the cache store, serves every object of the round.
    GroupListManager groups;
    const UserListManager users(&groups);
    for (const uint uid : uids) {
        const auto user = QSharedPointer<DBusKestServiceUser>::create();
        user->load(uid, users);
        m_users.insert(uid, user);
        const QString path = kUserObjectPath + QString::number(uid);
        qDebug().noquote() << QStringLiteral("uid=") + QString::number(uid) + QStringLiteral("userPath=") + path;
        if (!connection.registerVirtualObject(path, user.data())) {
            qWarning().noquote() << QStringLiteral("register user dbus object failed. error: ")
                    + errorText(connection.lastError());
            return false;
        }
    }
    return true;
}

void DBusKestService::clearUserObjects()
{
    QStringList paths;
    for (auto user = m_users.cbegin(); user != m_users.cend(); ++user) {
        const QString path = kUserObjectPath + QString::number(user.key());
        if (m_connection.objectRegisteredAt(path) != user.value().data())
            continue;
        // Else the connection answers each destruction with a blocking walk over all its paths.
        QObject::disconnect(user.value().data(), &QObject::destroyed, nullptr, nullptr);
        paths.append(path);
    }
    // The connection keeps its paths in sorted arrays: taken off from the end, each goes in constant time.
    std::sort(paths.begin(), paths.end(), std::greater<QString>());
    for (const QString &path : qAsConst(paths))
        m_connection.unregisterObject(path);
    m_users.clear();
}

void DBusKestService::controlCacheService(bool enable)
{
    const QString systemctl = QStringLiteral("/usr/bin/systemctl");
    const QString unit = QStringLiteral("cache-kest");
    QByteArray availabilityErrors;
    const QByteArray availability = runChild(
        systemctl, { enable ? QStringLiteral("enable") : QStringLiteral("disable"), unit }, &availabilityErrors);
    QByteArray controlErrors;
    const QByteArray control
        = runChild(systemctl, { enable ? QStringLiteral("start") : QStringLiteral("stop"), unit }, &controlErrors);
    qInfo().noquote() << QStringLiteral("set cache available: ") + QString::fromUtf8(availabilityErrors.trimmed())
            + QStringLiteral("......") + QString::fromUtf8(availability);
    qInfo().noquote() << QStringLiteral("control cache service: ") + QString::fromUtf8(controlErrors.trimmed())
            + QStringLiteral("......") + QString::fromUtf8(control);
}

QString DBusKestService::QueryPasswordConfig()
{
    const QSettings settings(KestPaths::settingsFile(), QSettings::IniFormat);
    return QString::fromUtf8(QJsonDocument(PasswordPolicy::read(settings)).toJson(QJsonDocument::Compact));
}

UidList DBusKestService::GetUserIdList()
{
    if (!isEnabled()) {
        qWarning().noquote() << QStringLiteral("[GetUserIdList]: enable false");
        return UidList();
    }
    UidList uids;
    const QList<quint32> cached = listCacheUids();
    for (const quint32 uid : cached)
        uids.append(uid);
    qDebug().nospace().noquote() << QStringLiteral("[GetUserIdList]: ") << uids;
    return uids;
}

QStringList DBusKestService::GetUserGroups(const QString &zusername)
{
    if (!isEnabled())
        return QStringList();
    const GroupListManager groups;
    return groups.groupsOfUser(zusername);
}

bool DBusKestService::RemoveCacheFile(uint uid)
{
    removeCacheFile(uid);
    if (isEnabled())
        syncLoginSessions();
    return true;
}

bool DBusKestService::RemoveCacheFilesNotInList(const UidList &whiteList)
{
    const QList<quint32> cached = listCacheUids();
    for (const quint32 uid : cached) {
        if (!whiteList.contains(uid))
            removeCacheFile(uid);
    }
    if (isEnabled())
        syncLoginSessions();
    return true;
}

bool DBusKestService::RemoveAllCacheFiles()
{
    removeAllCacheFiles();
    clearUserObjects();
    if (isEnabled())
        syncLoginSessions();
    return true;
}

bool DBusKestService::DisableTerminal(uint uid)
{
    if (!isEnabled())
        return false;
    CacheControlPtr record = createCacheControl();
    record->setUid(uid);
    // A uid without a record file leaves nothing to mark, which still counts as done.
    loadCacheRecord(record);
    if (!record)
        return true;
    record->setRemoveStatus(1);
    return saveCacheRecord(*record);
}

QString DBusKestService::ModifyUserPassword(
    const QString &userName, const QString &old_password, const QString &newPassword)
{
    if (!callerMayChangePassword(userName))
        return QStringLiteral("{\"code\":1,\"data\":null,\"msg\":\"permission denied !!!\"}");
    const QJsonObject request { { QStringLiteral("username"), userName }, { QStringLiteral("password"), newPassword },
        { QStringLiteral("old_password"), old_password } };
    // On standard input: every local user can read a command line in /proc.
    QByteArray output
        = runChild(QStringLiteral("cache-kest"), { QStringLiteral("--modify-user-passwd"), QStringLiteral("-") },
            nullptr, QJsonDocument(request).toJson(QJsonDocument::Compact));
    const int zero = output.indexOf('\0');
    if (zero >= 0)
        output.truncate(zero);
    return QString::fromUtf8(output);
}

void DBusKestService::SessionNew(const QString &sessionName, const QDBusObjectPath &path)
{
    qDebug().noquote() << QStringLiteral("session name: ") + sessionName + QStringLiteral(", session path: ")
            + path.path();
    QDBusMessage call = QDBusMessage::createMethodCall(
        kLogindService, path.path(), QStringLiteral("org.freedesktop.DBus.Properties"), QStringLiteral("Get"));
    call << QStringLiteral("org.freedesktop.login1.Session") << QStringLiteral("Name");
    const QDBusReply<QDBusVariant> reply = m_connection.call(call);
    if (!reply.isValid()) {
        qWarning().noquote() << QStringLiteral("cannot get session user name, session: ") + sessionName
                + QStringLiteral(", path: ") + path.path() + QStringLiteral(", error: ") + reply.error().message()
                + QStringLiteral(", ") + reply.error().message();
        return;
    }
    if (reply.value().variant().toString() == QLatin1String("lightdm")) {
        qDebug().noquote() << QStringLiteral("no need rescan logined users for session change event.");
        return;
    }
    clearUserObjects();
    registerUserObjects(m_connection);
}

void DBusKestService::syncLoginSessions()
{
    const QDBusMessage listCall
        = QDBusMessage::createMethodCall(kLogindService, kLogindPath, kLogindManager, QStringLiteral("ListSessions"));
    const QDBusMessage listReply = m_connection.call(listCall, QDBus::Block, kLogindTimeoutMs);
    if (listReply.type() == QDBusMessage::ErrorMessage) {
        qWarning().noquote() << "[" << kSyncTag << "] call systemd-logind. " << listReply.errorMessage();
        return;
    }
    const QDBusReply<SessionList> sessions(listReply);
    if (!sessions.isValid()) {
        qWarning().noquote() << "[" << kSyncTag << "] cannot get session list value. " << sessions.error().message();
        return;
    }
    const UidList cached = GetUserIdList();
    const SessionList list = sessions.value();
    for (const SessionInfo &session : list) {
        if (!cached.contains(session.userId))
            killSession(session.sessionId);
    }
}

void DBusKestService::killSession(const QString &sessionId)
{
    QDBusMessage call
        = QDBusMessage::createMethodCall(kLogindService, kLogindPath, kLogindManager, QStringLiteral("KillSession"));
    call << sessionId << QStringLiteral("all") << qint32(9);
    const QDBusMessage reply = m_connection.call(call, QDBus::Block, kLogindTimeoutMs);
    if (reply.type() == QDBusMessage::ErrorMessage)
        qWarning().noquote() << "[" << kSyncTag << "] terminate session failed. " << reply.errorMessage();
}

bool DBusKestService::callerMayChangePassword(const QString &userName) const
{
    if (!calledFromDBus())
        return true;
    const QDBusReply<uint> caller = connection().interface()->serviceUid(message().service());
    quint32 uid = 0;
    if (caller.isValid() && (caller.value() == 0 || (findCacheUidByAccount(userName, uid) && caller.value() == uid)))
        return true;
    qWarning().noquote() << QStringLiteral("refused password check of %1 from uid %2.")
                                .arg(userName)
                                .arg(caller.isValid() ? qint64(caller.value()) : -1);
    return false;
}
