#include "dbuskestserviceuser.h"

#include <QDBusConnection>
#include <QDBusConnectionInterface>
#include <QDBusMessage>
#include <QDBusVariant>
#include <QDebug>
#include <QMetaProperty>

namespace
{
const QString propertiesInterface = QStringLiteral("org.freedesktop.DBus.Properties");

QString signatureOf(const QVariant &value)
{
    return value.userType() == QMetaType::UInt ? QStringLiteral("u") : QStringLiteral("s");
}
} // namespace

const QString DBusKestServiceUser::interfaceName = QStringLiteral("com.nimbal.kest.iam.user");

DBusKestServiceUser::DBusKestServiceUser(QObject *parent)
    : QDBusVirtualObject(parent)
{
}

void DBusKestServiceUser::load(uint uid, const UserListManager &users)
{
    const UserEntryPtr entry = users.entryOfUid(uid);
    if (!entry) {
        qWarning().noquote() << QStringLiteral("There is no user that the id is uid.");
        return;
    }
    m_entry = entry;
}

uint DBusKestServiceUser::uid() const
{
    return m_entry ? m_entry->uid : 0;
}

uint DBusKestServiceUser::gid() const
{
    return m_entry ? m_entry->gid : 0;
}

QString DBusKestServiceUser::userName() const
{
    return m_entry ? m_entry->name : QString();
}

QString DBusKestServiceUser::password() const
{
    return m_entry ? m_entry->password : QString();
}

// The digest can be cracked offline: only root and the account itself may see it.
bool DBusKestServiceUser::callerMayReadPassword(const QDBusMessage &message, const QDBusConnection &connection) const
{
    const QDBusReply<uint> caller = connection.interface()->serviceUid(message.service());
    return caller.isValid() && (caller.value() == 0 || (m_entry && caller.value() == m_entry->uid));
}

QVariantMap DBusKestServiceUser::properties(bool withPassword) const
{
    QVariantMap values;
    const QMetaObject *meta = metaObject();
    for (int i = meta->propertyOffset(); i < meta->propertyCount(); ++i) {
        const QMetaProperty property = meta->property(i);
        values.insert(QLatin1String(property.name()), property.read(this));
    }
    if (!withPassword && m_entry)
        values.insert(QStringLiteral("Password"), QStringLiteral("x"));
    return values;
}

QString DBusKestServiceUser::introspect(const QString &path) const
{
    Q_UNUSED(path)
    QString xml = QStringLiteral("  <interface name=\"") + interfaceName + QStringLiteral("\">\n");
    const QMetaObject *meta = metaObject();
    for (int i = meta->propertyOffset(); i < meta->propertyCount(); ++i) {
        const QMetaProperty property = meta->property(i);
        xml += QStringLiteral("    <property name=\"%1\" type=\"%2\" access=\"read\"/>\n")
                   .arg(QLatin1String(property.name()), signatureOf(property.read(this)));
    }
    return xml + QStringLiteral("  </interface>\n");
}

bool DBusKestServiceUser::handleMessage(const QDBusMessage &message, const QDBusConnection &connection)
{
    if (message.interface() != propertiesInterface)
        return false;
    const QVariantList arguments = message.arguments();
    const QString interface = arguments.value(0).toString();
    if (!interface.isEmpty() && interface != interfaceName) {
        connection.send(
            message.createErrorReply(QDBusError::UnknownInterface, QStringLiteral("No such interface: ") + interface));
        return true;
    }
    const QString member = message.member();
    const bool wantsPassword = member == QLatin1String("GetAll")
        || (member == QLatin1String("Get") && arguments.value(1).toString() == QLatin1String("Password"));
    const QVariantMap values = properties(wantsPassword && callerMayReadPassword(message, connection));
    if (member == QLatin1String("GetAll")) {
        connection.send(message.createReply(QVariant::fromValue(values)));
        return true;
    }
    const QString name = arguments.value(1).toString();
    if (member == QLatin1String("Get") && values.contains(name)) {
        connection.send(message.createReply(QVariant::fromValue(QDBusVariant(values.value(name)))));
        return true;
    }
    const bool known = values.contains(name);
    connection.send(message.createErrorReply(known ? QDBusError::PropertyReadOnly : QDBusError::UnknownProperty,
        (known ? QStringLiteral("Read-only property: ") : QStringLiteral("No such property: ")) + name));
    return true;
}

QString DBusKestServiceUser::homeDir() const
{
    return m_entry ? m_entry->home : QString();
}

QString DBusKestServiceUser::shell() const
{
    return m_entry ? m_entry->shell : QString();
}

QString DBusKestServiceUser::gecos() const
{
    return m_entry ? m_entry->gecos : QString();
}
