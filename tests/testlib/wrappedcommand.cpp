#include "wrappedcommand.h"

#include <QProcess>
#include <QString>
#include <QStringList>

QByteArray WrappedCommand::modulePath(const char *name)
{
    return qgetenv("KEST_TEST_BINARY_DIR") + "/src/modules/" + name;
}

QByteArray WrappedCommand::run(const QByteArray &filesFolder, const QByteArray &command)
{
    // getent and pamtester are not instrumented: under the sanitizers their runtime comes first, and one
    // wrapper per program, since the two together bind libc deeply.
    const QByteArray preload = qgetenv("KEST_MODULE_PRELOAD");
    const QByteArray wrapper = command.contains("pamtester") ? "libpam_wrapper.so" : "libnss_wrapper.so";
    const QByteArray environment = "export LD_PRELOAD='" + (preload + ' ' + wrapper).trimmed()
        + "' NSS_WRAPPER_PASSWD=" + filesFolder + "/passwd NSS_WRAPPER_GROUP=" + filesFolder
        + "/group NSS_WRAPPER_MODULE_SO_PATH=" + modulePath("libnss_kest.so.2")
        + " NSS_WRAPPER_MODULE_FN_PREFIX=kest NSS_WRAPPER_DISABLE_DEEPBIND=" + (preload.isEmpty() ? "" : "1")
        + " PAM_WRAPPER=1 PAM_WRAPPER_SERVICE_DIR=" + filesFolder + "; ";
    QProcess process;
    process.setProcessChannelMode(QProcess::MergedChannels);
    process.start(QStringLiteral("bash"), { QStringLiteral("-c"), QString::fromUtf8(environment + command) });
    const int exitCode = process.waitForFinished(30000) ? process.exitCode() : -1;
    return QByteArray::number(exitCode) + ' ' + process.readAll();
}
