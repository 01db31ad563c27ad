#include "privatebus.h"

#include <QFile>

namespace {
const char addressVariable[] = "DBUS_SYSTEM_BUS_ADDRESS";
const int startTimeoutMs = 10000;

QByteArray policyBlock(PrivateBus::Policy policy)
{
    if (policy == PrivateBus::Policy::Open)
        return "  <policy context=\"default\">\n"
               "    <allow user=\"*\"/>\n"
               "    <allow own=\"*\"/>\n"
               "    <allow send_destination=\"*\" eavesdrop=\"true\"/>\n"
               "    <allow receive_sender=\"*\"/>\n"
               "  </policy>\n";
    return "  <policy context=\"default\">\n"
           "    <allow user=\"*\"/>\n"
           "    <deny own=\"*\"/>\n"
           "    <deny send_type=\"method_call\"/>\n"
           "    <allow send_type=\"signal\"/>\n"
           "    <allow send_requested_reply=\"true\" send_type=\"method_return\"/>\n"
           "    <allow send_requested_reply=\"true\" send_type=\"error\"/>\n"
           "    <allow receive_type=\"method_call\"/>\n"
           "    <allow receive_type=\"method_return\"/>\n"
           "    <allow receive_type=\"error\"/>\n"
           "    <allow receive_type=\"signal\"/>\n"
           "    <allow send_destination=\"org.freedesktop.DBus\" send_interface=\"org.freedesktop.DBus\"/>\n"
           "    <allow send_destination=\"org.freedesktop.DBus\" send_interface=\"org.freedesktop.DBus.Introspectable\"/>\n"
           "    <allow send_destination=\"org.freedesktop.DBus\" send_interface=\"org.freedesktop.DBus.Properties\"/>\n"
           "  </policy>\n"
           "  <policy user=\"root\">\n"
           "    <allow own=\"*\"/>\n"
           "    <allow send_type=\"method_call\" send_destination=\"org.freedesktop.login1\"/>\n"
           "    <allow send_type=\"method_call\" send_destination=\"com.nimbal.daemon.Accounts\"/>\n"
           "    <allow send_type=\"method_call\" send_destination=\"com.nimbal.ose.LockService\"/>\n"
           "  </policy>\n";
}
} // namespace

PrivateBus::PrivateBus(Policy policy, const QStringList &policyFiles)
    : m_previousAddress(qgetenv(addressVariable))
    , m_hadPreviousAddress(qEnvironmentVariableIsSet(addressVariable))
{
    if (!m_dir.isValid()) {
        m_error = QStringLiteral("cannot create a temporary directory");
        return;
    }
    const QString config = m_dir.filePath(QStringLiteral("bus.conf"));
    if (!writeConfig(policy, policyFiles, config)) {
        m_error = QStringLiteral("cannot write ") + config;
        return;
    }
    m_daemon.setProgram(QStringLiteral("dbus-daemon"));
    m_daemon.setArguments({ QStringLiteral("--config-file=") + config, QStringLiteral("--nofork"),
                            QStringLiteral("--nopidfile"), QStringLiteral("--print-address=1") });
    m_daemon.setProcessChannelMode(QProcess::ForwardedErrorChannel);
    m_daemon.start();
    if (!m_daemon.waitForStarted(startTimeoutMs)) {
        m_error = QStringLiteral("dbus-daemon did not start: ") + m_daemon.errorString();
        return;
    }
    while (!m_daemon.canReadLine() && m_daemon.waitForReadyRead(startTimeoutMs)) { }
    m_address = QString::fromUtf8(m_daemon.readLine()).trimmed();
    if (m_address.isEmpty()) {
        m_error = QStringLiteral("dbus-daemon printed no address");
        return;
    }
    qputenv(addressVariable, m_address.toUtf8());
}

PrivateBus::~PrivateBus()
{
    if (m_daemon.state() != QProcess::NotRunning) {
        m_daemon.terminate();
        if (!m_daemon.waitForFinished(5000))
            m_daemon.kill();
        m_daemon.waitForFinished(5000);
    }
    if (m_hadPreviousAddress)
        qputenv(addressVariable, m_previousAddress);
    else
        qunsetenv(addressVariable);
}

bool PrivateBus::isRunning() const
{
    return !m_address.isEmpty() && m_daemon.state() == QProcess::Running;
}

bool PrivateBus::openToOtherUsers()
{
    // Traverse only: others reach the socket by name but cannot list or change the directory.
    return QFile::setPermissions(m_dir.path(), QFileDevice::ReadOwner | QFileDevice::WriteOwner | QFileDevice::ExeOwner
                                     | QFileDevice::ExeGroup | QFileDevice::ExeOther);
}

QString PrivateBus::address() const
{
    return m_address;
}

QString PrivateBus::errorText() const
{
    return m_error;
}

bool PrivateBus::writeConfig(Policy policy, const QStringList &policyFiles, const QString &path) const
{
    QByteArray text = "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN\"\n"
                      " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n"
                      "<busconfig>\n"
                      "  <type>system</type>\n"
                      "  <listen>unix:path="
        + QFile::encodeName(m_dir.filePath(QStringLiteral("system_bus_socket")))
        + "</listen>\n"
          "  <auth>EXTERNAL</auth>\n"
        + policyBlock(policy);
    for (const QString &file : policyFiles)
        text += "  <include>" + QFile::encodeName(file) + "</include>\n";
    text += "</busconfig>\n";

    QFile file(path);
    return file.open(QIODevice::WriteOnly) && file.write(text) == text.size();
}
