// kest-fake-peers: logind, the accounts daemon and the lock service as the front service sees them, on the
// bus named by DBUS_SYSTEM_BUS_ADDRESS. Prints "ready" once every name is owned.
#include "callrecord.h"
#include "dbuskesttypes.h"
#include "fakeaccounts.h"
#include "fakecontrol.h"
#include "fakelockservice.h"
#include "fakeloginmanager.h"

#include <QCoreApplication>
#include <QDBusConnection>
#include <QTextStream>

#include <csignal>
#include <sys/prctl.h>

namespace
{
struct Export {
    const char *path;
    QObject *object;
};

bool publish(QDBusConnection &connection, const QList<Export> &exports, QTextStream &err)
{
    for (const Export &entry : exports) {
        if (!connection.registerObject(QLatin1String(entry.path), entry.object, QDBusConnection::ExportAllContents)) {
            err << "cannot register " << entry.path << ": " << connection.lastError().message() << Qt::endl;
            return false;
        }
    }
    for (const char *name : { "org.freedesktop.login1", "com.nimbal.daemon.Accounts", "com.nimbal.ose.LockService" }) {
        if (!connection.registerService(QLatin1String(name))) {
            err << "cannot own " << name << ": " << connection.lastError().message() << Qt::endl;
            return false;
        }
    }
    return true;
}
} // namespace

int main(int argc, char *argv[])
{
    // Never outlive the test that started it.
    prctl(PR_SET_PDEATHSIG, SIGTERM);
    QCoreApplication app(argc, argv);
    registerKestDBusTypes();
    QTextStream err(stderr);
    QDBusConnection connection = QDBusConnection::systemBus();
    if (!connection.isConnected()) {
        err << "no bus: " << connection.lastError().message() << Qt::endl;
        return 1;
    }
    CallRecord record;
    FakeLoginManager loginManager(connection, &record);
    FakeAccounts accounts(&record);
    FakeLockService lockService(&record);
    FakeControl control(&record, &loginManager);
    const QList<Export> exports { { "/org/freedesktop/login1", &loginManager },
        { "/com/nimbal/daemon/Accounts", &accounts }, { "/com/nimbal/ose/LockService", &lockService },
        { "/com/nimbal/kest/test/Peers", &control } };
    if (!publish(connection, exports, err))
        return 1;
    QTextStream(stdout) << "ready" << Qt::endl;
    return app.exec();
}
