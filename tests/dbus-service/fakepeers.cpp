#include "fakepeers.h"

#include <QDBusMessage>
#include <QDBusReply>

namespace
{
const int startTimeoutMs = 10000;
}

FakePeers::FakePeers()
    : m_bus(QString())
{
}

FakePeers::~FakePeers()
{
    if (m_process.state() == QProcess::NotRunning)
        return;
    m_process.terminate();
    if (!m_process.waitForFinished(5000))
        m_process.kill();
    m_process.waitForFinished(5000);
}

bool FakePeers::start(const QDBusConnection &bus)
{
    m_bus = bus;
    m_process.setProgram(
        qEnvironmentVariable("KEST_TEST_BINARY_DIR") + QStringLiteral("/tests/dbus-service/kest-fake-peers"));
    m_process.setProcessChannelMode(QProcess::ForwardedErrorChannel);
    m_process.start();
    if (!m_process.waitForStarted(startTimeoutMs)) {
        m_error = QStringLiteral("kest-fake-peers did not start: ") + m_process.errorString();
        return false;
    }
    while (!m_process.canReadLine() && m_process.waitForReadyRead(startTimeoutMs)) { }
    if (m_process.readLine().trimmed() != "ready") {
        m_error = QStringLiteral("kest-fake-peers did not get ready");
        return false;
    }
    return true;
}

QString FakePeers::errorText() const
{
    return m_error;
}

QStringList FakePeers::calls() const
{
    const QDBusReply<QStringList> reply = control(QStringLiteral("Calls"));
    return reply.isValid() ? reply.value() : QStringList { QStringLiteral("<no answer from the fake peers>") };
}

QStringList FakePeers::callsStartingWith(const QString &prefix) const
{
    QStringList matching;
    const QStringList all = calls();
    for (const QString &call : all) {
        if (call.startsWith(prefix))
            matching.append(call);
    }
    return matching;
}

bool FakePeers::reset()
{
    return control(QStringLiteral("Reset")).type() == QDBusMessage::ReplyMessage;
}

bool FakePeers::addSession(const QString &id, uint uid, const QString &userName, const QString &seat)
{
    return control(QStringLiteral("AddSession"), { id, uid, userName, seat }).type() == QDBusMessage::ReplyMessage;
}

bool FakePeers::emitSessionNew(const QString &id)
{
    return control(QStringLiteral("EmitSessionNew"), { id }).type() == QDBusMessage::ReplyMessage;
}

bool FakePeers::failMethod(const QString &member)
{
    return control(QStringLiteral("FailMethod"), { member }).type() == QDBusMessage::ReplyMessage;
}

QDBusMessage FakePeers::control(const QString &member, const QVariantList &arguments) const
{
    QDBusMessage call = QDBusMessage::createMethodCall(QStringLiteral("org.freedesktop.login1"),
        QStringLiteral("/com/nimbal/kest/test/Peers"), QStringLiteral("com.nimbal.kest.test.Peers"), member);
    call.setArguments(arguments);
    // Block with events: a service living in the test process may have to answer meanwhile.
    return m_bus.call(call, QDBus::BlockWithGui);
}
