#include "privatebus.h"

#include <QFile>

namespace
{
const char addressVariable[] = "DBUS_SYSTEM_BUS_ADDRESS";

QByteArray policyBlock(const QString &policyFile)
{
    if (policyFile.isEmpty())
        return "<policy context=\"default\"><allow user=\"*\"/><allow own=\"*\"/>\n"
               "<allow send_destination=\"*\" eavesdrop=\"true\"/><allow receive_sender=\"*\"/></policy>\n";
    // Replies and signals pass; method calls only where a policy allows them, as on the machine's bus.
    QByteArray text = "<policy context=\"default\"><allow user=\"*\"/><deny own=\"*\"/>\n"
                      "<deny send_type=\"method_call\"/><allow send_type=\"signal\"/>\n"
                      "<allow send_requested_reply=\"true\" send_type=\"method_return\"/>\n"
                      "<allow send_requested_reply=\"true\" send_type=\"error\"/>\n";
    for (const char *type : { "method_call", "method_return", "error", "signal" })
        text += QByteArray("<allow receive_type=\"") + type + "\"/>\n";
    for (const char *interface : { "", ".Introspectable", ".Properties" })
        text += QByteArray("<allow send_destination=\"org.freedesktop.DBus\" send_interface=\"org.freedesktop.DBus")
            + interface + "\"/>\n";
    text += "</policy>\n<policy user=\"root\"><allow own=\"*\"/>\n";
    for (const char *peer : { "org.freedesktop.login1", "com.nimbal.daemon.Accounts", "com.nimbal.ose.LockService" })
        text += QByteArray("<allow send_type=\"method_call\" send_destination=\"") + peer + "\"/>\n";
    return text + "</policy>\n<include>" + QFile::encodeName(policyFile) + "</include>\n";
}
} // namespace

PrivateBus::PrivateBus(const QString &policyFile)
    : m_previousAddress(qgetenv(addressVariable))
    , m_hadPreviousAddress(qEnvironmentVariableIsSet(addressVariable))
{
    QByteArray config = "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN\"\n"
                        " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
                        "<busconfig><type>system</type><auth>EXTERNAL</auth>\n<listen>unix:path="
        + QFile::encodeName(m_dir.filePath(QStringLiteral("system_bus_socket"))) + "</listen>\n"
        + policyBlock(policyFile) + "</busconfig>\n";
    QFile configFile(m_dir.filePath(QStringLiteral("bus.conf")));
    if (!m_dir.isValid() || !configFile.open(QIODevice::WriteOnly) || configFile.write(config) != config.size()) {
        m_error = QStringLiteral("cannot write the bus configuration in ") + m_dir.path();
        return;
    }
    configFile.close();
    QFile::setPermissions(m_dir.path(),
        QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ExeOwner | QFileDevice::ExeGroup
            | QFileDevice::ExeOther);
    m_daemon.setProcessChannelMode(QProcess::ForwardedErrorChannel);
    m_daemon.start(QStringLiteral("dbus-daemon"),
        { QStringLiteral("--config-file=") + configFile.fileName(), QStringLiteral("--nofork"),
            QStringLiteral("--nopidfile"), QStringLiteral("--print-address=1") });
    while (!m_daemon.canReadLine() && m_daemon.waitForReadyRead(10000)) { }
    m_address = QString::fromUtf8(m_daemon.readLine()).trimmed();
    if (m_address.isEmpty()) {
        m_error = QStringLiteral("dbus-daemon printed no address: ") + m_daemon.errorString();
        return;
    }
    qputenv(addressVariable, m_address.toUtf8());
}

PrivateBus::~PrivateBus()
{
    m_daemon.terminate();
    if (!m_daemon.waitForFinished(5000))
        m_daemon.kill();
    m_daemon.waitForFinished(5000);
    m_hadPreviousAddress ? qputenv(addressVariable, m_previousAddress) : qunsetenv(addressVariable);
}
