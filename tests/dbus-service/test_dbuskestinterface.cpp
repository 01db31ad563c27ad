#include "privatebus.h"
#include "serviceprocess.h"
#include "testaccounts.h"
#include "testroot.h"

#include <QFile>
#include <QProcess>
#include <QTest>
#include <QXmlStreamReader>

namespace
{
// One line per property, method, signal, argument and annotation of the named interface, in document order,
// so that a difference shows as the first line that differs.
QStringList interfaceMembers(const QByteArray &xml, const QString &interfaceName, QString *error)
{
    QXmlStreamReader reader(xml);
    QStringList lines;
    bool inside = false;
    bool found = false;
    QString defaultDirection;
    while (!reader.atEnd()) {
        reader.readNext();
        if (reader.isEndElement() && reader.name() == QLatin1String("interface"))
            inside = false;
        if (!reader.isStartElement())
            continue;
        const QString element = reader.name().toString();
        const QXmlStreamAttributes attributes = reader.attributes();
        const QString name = attributes.value(QLatin1String("name")).toString();
        if (element == QLatin1String("interface")) {
            inside = name == interfaceName;
            found = found || inside;
            continue;
        }
        if (!inside)
            continue;
        if (element == QLatin1String("method") || element == QLatin1String("signal")) {
            defaultDirection = element == QLatin1String("method") ? QStringLiteral("in") : QStringLiteral("out");
            lines.append(element + QLatin1Char(' ') + name);
        } else if (element == QLatin1String("property")) {
            lines.append(QStringLiteral("property ") + name + QLatin1Char(' ') + attributes.value(QLatin1String("type"))
                + QLatin1Char(' ') + attributes.value(QLatin1String("access")));
        } else if (element == QLatin1String("arg")) {
            const QString direction = attributes.value(QLatin1String("direction")).toString();
            lines.append(QStringLiteral("  arg ") + (direction.isEmpty() ? defaultDirection : direction)
                + QLatin1Char(' ') + attributes.value(QLatin1String("type")) + QLatin1Char(' ') + name);
        } else if (element == QLatin1String("annotation")) {
            lines.append(
                QStringLiteral("  annotation ") + name + QLatin1Char('=') + attributes.value(QLatin1String("value")));
        } else {
            lines.append(QStringLiteral("unexpected element ") + element);
        }
    }
    if (reader.hasError())
        *error = reader.errorString();
    else if (!found)
        *error = QStringLiteral("no interface ") + interfaceName;
    return lines;
}

QStringList childNodes(const QByteArray &xml)
{
    QXmlStreamReader reader(xml);
    QStringList children;
    int depth = 0;
    while (!reader.atEnd()) {
        reader.readNext();
        if (reader.isEndElement())
            --depth;
        if (!reader.isStartElement())
            continue;
        ++depth;
        if (depth == 2 && reader.name() == QLatin1String("node"))
            children.append(reader.attributes().value(QLatin1String("name")).toString());
    }
    return children;
}

// What a real client sees: gdbus asks the service over the bus named by DBUS_SYSTEM_BUS_ADDRESS.
QByteArray introspect(const QString &path, QString *error)
{
    QProcess gdbus;
    gdbus.start(QStringLiteral("gdbus"),
        { QStringLiteral("introspect"), QStringLiteral("--system"), QStringLiteral("--dest"),
            ServiceProcess::serviceName(), QStringLiteral("--object-path"), path, QStringLiteral("--xml") });
    if (!gdbus.waitForFinished(30000) || gdbus.exitStatus() != QProcess::NormalExit || gdbus.exitCode() != 0) {
        *error = QStringLiteral("gdbus introspect failed: ") + gdbus.errorString() + QLatin1Char(' ')
            + QString::fromUtf8(gdbus.readAllStandardError());
        return QByteArray();
    }
    return gdbus.readAllStandardOutput();
}
} // namespace

// The published interfaces against their checked record in data/interfaces.
class DBusKestInterfaceTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void initTestCase()
    {
        QVERIFY2(m_bus.isRunning(), qPrintable(m_bus.errorText()));
        m_connection = QDBusConnection::connectToBus(m_bus.address(), QStringLiteral("interface-test"));
        QVERIFY(m_root.isValid());
        QVERIFY(m_root.writeSettings("[main]\nenable=true\n"));
        QVERIFY(writeCacheRecords(
            { testAccount(10001, QStringLiteral("@alice")), testAccount(10002, QStringLiteral("@bob")) }));
        QVERIFY(m_service.start());
        QVERIFY(m_service.waitUntilServing(m_connection));
    }

    void cleanupTestCase()
    {
        QVERIFY(m_service.stop());
        QDBusConnection::disconnectFromBus(QStringLiteral("interface-test"));
    }

    void publishedAsRecorded_data()
    {
        QTest::addColumn<QString>("path");
        QTest::addColumn<QString>("interfaceName");

        QTest::newRow("main object") << servicePath() << QStringLiteral("com.nimbal.kest.iam");
        QTest::newRow("per-user object") << userObjectPath(10002) << QStringLiteral("com.nimbal.kest.iam.user");
    }

    void publishedAsRecorded()
    {
        QFETCH(QString, path);
        QFETCH(QString, interfaceName);

        QFile recordFile(QStringLiteral(KEST_INTERFACES_DIR "/") + interfaceName + QStringLiteral(".xml"));
        QVERIFY2(recordFile.open(QIODevice::ReadOnly), qPrintable(recordFile.fileName()));
        QString error;
        const QStringList recorded = interfaceMembers(recordFile.readAll(), interfaceName, &error);
        QVERIFY2(error.isEmpty(), qPrintable(error));
        QVERIFY(!recorded.isEmpty());

        const QByteArray published = introspect(path, &error);
        QVERIFY2(error.isEmpty(), qPrintable(error));
        const QStringList members = interfaceMembers(published, interfaceName, &error);
        QVERIFY2(error.isEmpty(), qPrintable(error + QLatin1Char('\n') + QString::fromUtf8(published)));
        QCOMPARE(members, recorded);
    }

    void onePerUserObjectPerCachedUser()
    {
        QString error;
        const QByteArray published = introspect(servicePath(), &error);
        QVERIFY2(error.isEmpty(), qPrintable(error));
        QStringList children = childNodes(published);
        children.sort();
        QCOMPARE(children, QStringList({ QStringLiteral("user10001"), QStringLiteral("user10002") }));
    }

private:
    PrivateBus m_bus;
    TestRoot m_root;
    QDBusConnection m_connection { QString() };
    ServiceProcess m_service;
};

QTEST_GUILESS_MAIN(DBusKestInterfaceTest)
#include "test_dbuskestinterface.moc"
