#include "privatebus.h"

#include <QDBusConnection>
#include <QDBusConnectionInterface>
#include <QDBusMessage>
#include <QDBusReply>
#include <QTest>

#include <algorithm>

class Echo : public QObject
{
    Q_OBJECT
    Q_CLASSINFO("D-Bus Interface", "org.example.Echo")

public Q_SLOTS:
    QString Reverse(QString text)
    {
        std::reverse(text.begin(), text.end());
        return text;
    }
};

class PrivateBusTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void ownsNameAndAnswersCalls()
    {
        PrivateBus bus;
        QVERIFY2(bus.isRunning(), qPrintable(bus.errorText()));
        QCOMPARE(qgetenv("DBUS_SYSTEM_BUS_ADDRESS"), bus.address().toUtf8());

        // The service on a connection of its own, the caller through the system bus, so the call crosses the
        // bus; the caller keeps processing events because the service answers on this same thread.
        QDBusConnection service = QDBusConnection::connectToBus(bus.address(), QStringLiteral("service"));
        QVERIFY2(service.isConnected(), qPrintable(service.lastError().message()));
        Echo echo;
        QVERIFY(service.registerObject(QStringLiteral("/echo"), &echo, QDBusConnection::ExportAllSlots));
        QVERIFY(service.registerService(QStringLiteral("org.example.Echo")));

        QDBusConnection system = QDBusConnection::systemBus();
        QVERIFY(system.isConnected() && system.interface()->isServiceRegistered(QStringLiteral("org.example.Echo")));
        QDBusMessage call = QDBusMessage::createMethodCall(QStringLiteral("org.example.Echo"), QStringLiteral("/echo"),
            QStringLiteral("org.example.Echo"), QStringLiteral("Reverse"));
        call << QStringLiteral("kest");
        QDBusReply<QString> reply = system.call(call, QDBus::BlockWithGui);
        QVERIFY2(reply.isValid(), qPrintable(reply.error().message()));
        QCOMPARE(reply.value(), QStringLiteral("tsek"));
        QDBusConnection::disconnectFromBus(QStringLiteral("service"));
    }
};

QTEST_GUILESS_MAIN(PrivateBusTest)
#include "test_privatebus.moc"
