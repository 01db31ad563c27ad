#include "logindstandin.h"

#include <QDBusConnection>
#include <QDBusMessage>
#include <QDBusVariant>
#include <QDBusVirtualObject>

namespace
{
const QString service = QStringLiteral("org.freedesktop.login1");

// Every session belongs to "bench", which is not the display manager's user.
class Sessions : public QDBusVirtualObject
{
public:
    QString introspect(const QString &) const override { return QString(); }
    bool handleMessage(const QDBusMessage &message, const QDBusConnection &connection) override
    {
        if (message.member() == QLatin1String("Get"))
            connection.send(message.createReply(QVariant::fromValue(QDBusVariant(QStringLiteral("bench")))));
        else
            connection.send(message.createErrorReply(QDBusError::NotSupported, QStringLiteral("not in the stand-in")));
        return true;
    }
};
} // namespace

LogindStandIn::~LogindStandIn()
{
    quit();
    wait();
}

bool LogindStandIn::begin(const QString &address)
{
    m_address = address;
    start();
    m_ready.acquire();
    return m_owned;
}

void LogindStandIn::run()
{
    static int instances = 0;
    const QString name = QStringLiteral("logind-%1").arg(++instances);
    QDBusConnection bus = QDBusConnection::connectToBus(m_address, name);
    Sessions sessions;
    m_owned = bus.registerService(service)
        && bus.registerVirtualObject(QStringLiteral("/org/freedesktop/login1"), &sessions, QDBusConnection::SubPath);
    m_ready.release();
    exec();
    bus.unregisterObject(QStringLiteral("/org/freedesktop/login1"));
    QDBusConnection::disconnectFromBus(name);
}
