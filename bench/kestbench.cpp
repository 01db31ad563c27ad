// kest-bench: latencies of cache-kest against floors measured in the same run, sample by sample (run by
// tools/bench.sh).
#include "accountmap.h"
#include "accountmappublisher.h"
#include "blackhole.h"
#include "cachecontrolfactory.h"
#include "cachecontrolinterface.h"
#include "cachedaemonfixture.h"
#include "cachestore.h"
#include "domainconnection.h"
#include "domainserverfixture.h"
#include "echoserver.h"
#include "kestpaths.h"
#include "logindstandin.h"
#include "negativeanswers.h"
#include "privatebus.h"
#include "rawconnection.h"
#include "testroot.h"
#include "userlistmanager.h"

#include <QCoreApplication>
#include <QDBusConnection>
#include <QDBusMessage>
#include <QDBusObjectPath>
#include <QDateTime>
#include <QElapsedTimer>
#include <QFile>
#include <QFileInfo>
#include <QProcess>
#include <QSslCertificate>
#include <QSslKey>
#include <QSslSocket>
#include <QTcpServer>
#include <QTemporaryDir>
#include <QTest>
#include <QTextStream>
#include <QThread>

#include <algorithm>
#include <functional>
#include <utility>

#include <dlfcn.h>
#include <grp.h>
#include <pwd.h>
#include <sched.h>
#include <unistd.h>

namespace
{
struct Row {
    QString name;
    QList<double> samples; // milliseconds
    QString floor; // empty: no ratio
};

double percentile(QList<double> samples, double fraction)
{
    if (samples.isEmpty())
        return 0;
    std::sort(samples.begin(), samples.end());
    return samples.at(qMin(samples.size() - 1, int(fraction * samples.size())));
}

bool roundTrip(quint16 port, const QByteArray &frame, QByteArray *reply = nullptr)
{
    char buffer[65536];
    const int length = RawConnection::exchange(port, frame, buffer, sizeof(buffer));
    if (length >= 4 && reply)
        *reply = QByteArray(buffer + 4, length - 4);
    return length >= 4;
}

// The timed client runs on one core and every server it is timed against (echo floor, domain server,
// daemons) on another, whichever process or thread started them. Left to the scheduler, a round trip
// to a thread of the client's own process is often served on the client's core, a hand-off no server
// process gets, and the ratios then measured placement rather than the daemon.
struct Cores {
    int client = -1;
    int server = -1; // -1: a single core, nothing is moved
};
Cores cores;

void splitCores()
{
    cpu_set_t allowed;
    CPU_ZERO(&allowed);
    if (sched_getaffinity(0, sizeof(allowed), &allowed) != 0)
        return;
    for (int cpu = 0; cpu < CPU_SETSIZE && cores.server < 0; ++cpu) {
        if (CPU_ISSET(cpu, &allowed))
            (cores.client < 0 ? cores.client : cores.server) = cpu;
    }
}

// Threads and processes inherit the core of the thread that starts them: outside measure() that is
// the servers' core.
void runOn(int cpu)
{
    if (cores.server < 0)
        return;
    cpu_set_t set;
    CPU_ZERO(&set);
    CPU_SET(cpu, &set);
    sched_setaffinity(0, sizeof(set), &set);
}

// A floor is sampled alongside the rows held against it, one of its samples before each of theirs, so
// that both see the same load of a shared machine.
struct Floor {
    Row row;
    std::function<void()> action;
};

double timed(const std::function<void()> &action)
{
    QElapsedTimer timer;
    timer.start();
    action();
    return double(timer.nsecsElapsed()) / 1e6;
}

QList<double> measure(int count, const std::function<void()> &action, Floor *floor = nullptr)
{
    QList<double> samples;
    runOn(cores.client);
    for (int i = 0; i < count; ++i) {
        if (floor)
            floor->row.samples << timed(floor->action);
        samples << timed(action);
    }
    runOn(cores.server);
    return samples;
}

// The look-up and the login rows of one state of the daemon, each sample beside one of the floor's.
QList<Row> lookUpAndLogin(
    const QString &state, quint16 port, const QByteArray &lookUp, const QByteArray &login, int count, Floor &floor)
{
    QList<Row> rows;
    for (const auto &[kind, frame] : { std::pair { "look-up, ", &lookUp }, std::pair { "login, ", &login } })
        rows << Row { QLatin1String(kind) + state,
            measure(
                count, [&] { roundTrip(port, *frame); }, &floor),
            floor.row.name };
    return rows;
}

QByteArray call(const char *function, const QStringList &argv)
{
    return CacheDaemonFixture::frame(CacheDaemonFixture::functionCall(QLatin1String(function), argv));
}

QString rssOf(qint64 pid)
{
    QFile status(QStringLiteral("/proc/%1/status").arg(pid));
    if (!status.open(QIODevice::ReadOnly))
        return QStringLiteral("?");
    for (const QByteArray &line : status.readAll().split('\n')) {
        if (line.startsWith("VmRSS:"))
            return QString::fromLatin1(line.mid(6).simplified());
    }
    return QStringLiteral("?");
}

QString machine()
{
    QFile cpu(QStringLiteral("/proc/cpuinfo"));
    QString model = QStringLiteral("unknown CPU");
    if (cpu.open(QIODevice::ReadOnly)) {
        for (const QByteArray &line : cpu.readAll().split('\n')) {
            if (line.startsWith("model name")) {
                model = QString::fromLatin1(line.mid(line.indexOf(':') + 1).trimmed());
                break;
            }
        }
    }
    const QString placement = cores.server < 0
        ? QStringLiteral("client and servers on one core")
        : QStringLiteral("client on CPU %1, servers on CPU %2").arg(cores.client).arg(cores.server);
    return model + QStringLiteral(", ") + QString::number(sysconf(_SC_NPROCESSORS_ONLN)) + QStringLiteral(" cores; ")
        + placement;
}

DomainEndpoint endpointOf(const DomainServerFixture &server)
{
    DomainEndpoint endpoint;
    endpoint.address = QHostAddress(DomainServerFixture::address());
    endpoint.port = server.port();
    endpoint.tls = true;
    return endpoint;
}

// The client's TLS set-up, without the daemon's settings: the floor is the wire and the server alone.
QSslConfiguration tlsOf(const DomainServerFixture &server)
{
    QSslConfiguration tls = QSslConfiguration::defaultConfiguration();
    tls.setCaCertificates(QSslCertificate::fromPath(server.filePath(QStringLiteral("ca.pem"))));
    tls.setLocalCertificateChain(QSslCertificate::fromPath(server.filePath(QStringLiteral("client.pem"))));
    QFile key(server.filePath(QStringLiteral("client.key")));
    key.open(QIODevice::ReadOnly);
    tls.setPrivateKey(QSslKey(&key, QSsl::Rsa));
    tls.setSslOption(QSsl::SslOptionDisableSessionPersistence, false);
    tls.setPeerVerifyMode(QSslSocket::VerifyPeer);
    return tls;
}

// getpwnam_r through the built name-service module, the way glibc calls it.
QList<Row> moduleRows(Floor &floor)
{
    using GetPwNam = int (*)(const char *, passwd *, char *, size_t, int *);
    const QByteArray path = QFile::encodeName(
        qEnvironmentVariable("KEST_TEST_BINARY_DIR") + QStringLiteral("/src/modules/libnss_kest.so.2"));
    void *module = dlopen(path.constData(), RTLD_NOW | RTLD_LOCAL);
    const auto getpwnam = module ? reinterpret_cast<GetPwNam>(dlsym(module, "_nss_kest_getpwnam_r")) : nullptr;
    if (!getpwnam) {
        QTextStream(stderr) << "cannot load " << path << Qt::endl;
        return {};
    }
    const auto lookUp = [getpwnam](const char *name) {
        passwd entry;
        char buffer[1024];
        int error = 0;
        getpwnam(name, &entry, buffer, sizeof(buffer), &error);
    };
    QList<Row> rows { { QStringLiteral("getpwnam_r through the module, cached account"),
        measure(
            200, [&] { lookUp("@alice"); }, &floor),
        floor.row.name } };
    // A local name is turned away before any I/O: thousands of calls per sample show it costs no system call.
    rows << Row { QStringLiteral("getpwnam_r through the module, local name (per 1000 calls)"),
        measure(200,
            [&] {
                for (int i = 0; i < 1000; ++i)
                    lookUp("root");
            }),
        floor.row.name };
    dlclose(module);
    return rows;
}

// The daemon's CPU time so far, in clock ticks.
qint64 cpuTicksOf(qint64 pid)
{
    QFile stat(QStringLiteral("/proc/%1/stat").arg(pid));
    if (!stat.open(QIODevice::ReadOnly))
        return -1;
    const QByteArray text = stat.readAll();
    const QList<QByteArray> fields = text.mid(text.lastIndexOf(')') + 2).split(' ');
    return fields.size() > 12 ? fields.at(11).toLongLong() + fields.at(12).toLongLong() : -1;
}

// The look-ups the account map answers, through the module as glibc calls it; prefix names the daemon's state.
QList<Row> mapRows(const QString &prefix, Floor &floor, qint64 daemonPid, QStringList &notes)
{
    using GetPwNam = int (*)(const char *, passwd *, char *, size_t, int *);
    using GetPwUid = int (*)(uid_t, passwd *, char *, size_t, int *);
    using InitGroups = int (*)(const char *, gid_t, long *, long *, gid_t **, long, int *);
    const QByteArray path = QFile::encodeName(
        qEnvironmentVariable("KEST_TEST_BINARY_DIR") + QStringLiteral("/src/modules/libnss_kest.so.2"));
    void *module = dlopen(path.constData(), RTLD_NOW | RTLD_LOCAL);
    const auto getpwnam = module ? reinterpret_cast<GetPwNam>(dlsym(module, "_nss_kest_getpwnam_r")) : nullptr;
    const auto getpwuid = module ? reinterpret_cast<GetPwUid>(dlsym(module, "_nss_kest_getpwuid_r")) : nullptr;
    const auto initgroups = module ? reinterpret_cast<InitGroups>(dlsym(module, "_nss_kest_initgroups_dyn")) : nullptr;
    if (!getpwnam || !getpwuid || !initgroups)
        return {};
    passwd entry;
    char buffer[1024];
    int error = 0;
    const auto byName = [&](const char *name) { return getpwnam(name, &entry, buffer, sizeof(buffer), &error); };
    const auto groupsOf = [&] {
        long start = 0, size = 8;
        auto *groups = static_cast<gid_t *>(malloc(size * sizeof(gid_t)));
        initgroups("@alice", 10000, &start, &size, &groups, 0, &error);
        free(groups);
    };
    // Ten calls a sample: one is near the timer's own cost.
    const auto tenTimes = [](const std::function<void()> &action) {
        return [action] {
            for (int i = 0; i < 10; ++i)
                action();
        };
    };
    const qint64 ticksBefore = daemonPid > 0 ? cpuTicksOf(daemonPid) : 0;
    QList<Row> rows;
    rows << Row { prefix + QStringLiteral("getpwnam_r, cached account (per 10 calls)"),
        measure(500, tenTimes([&] { byName("@alice"); }), &floor), floor.row.name };
    if (daemonPid > 0) {
        rows << Row { prefix + QStringLiteral("getpwuid_r, cached account (per 10 calls)"),
            measure(500, tenTimes([&] { getpwuid(10001, &entry, buffer, sizeof(buffer), &error); }), &floor),
            floor.row.name };
        rows << Row { prefix + QStringLiteral("initgroups_dyn, cached account (per 10 calls)"),
            measure(500, tenTimes(groupsOf), &floor), floor.row.name };
        notes << prefix
                + QStringLiteral("cache-kest CPU over 15,000 map look-ups: %1 clock ticks")
                      .arg(cpuTicksOf(daemonPid) - ticksBefore);
        byName("@nobody");
        // The daemon answers first and publishes the negative answer a few milliseconds later: the row
        // measures the look-ups after that.
        QThread::msleep(100);
        rows << Row { prefix + QStringLiteral("getpwnam_r, unknown name again within the negative time (per 10 calls)"),
            measure(200, tenTimes([&] { byName("@nobody"); }), &floor), floor.row.name };
    }
    dlclose(module);
    return rows;
}

bool writeRecord(uint uid, const QString &gecos);

// Runs the event loop until the map file is replaced; milliseconds from timer's start.
double untilMapReplaced(const QElapsedTimer &timer, const FileVersion &before)
{
    while (FileVersion::of(KestPaths::accountMapFile(), false) == before && timer.elapsed() < 5000) {
        QCoreApplication::processEvents();
        QThread::usleep(100);
    }
    return double(timer.nsecsElapsed()) / 1e6;
}

// The map of count accounts: its size, the time to lay it out, to build it from scratch and again after
// one record changed, and how soon a change by another process or a new negative answer shows in it.
void mapScale(int count, uint firstUid, QStringList &notes)
{
    AccountMap accounts;
    for (int i = 0; i < count; ++i) {
        const QByteArray name = "@user" + QByteArray::number(20000 + i);
        accounts.addAccount({ quint32(20000 + i), 10000, name, "User", "/home/" + name, "/bin/bash" }, true);
    }
    QElapsedTimer timer;
    timer.start();
    const QByteArray bytes = accounts.toBytes();
    const double layout = double(timer.nsecsElapsed()) / 1e6;
    NegativeAnswers negatives;
    AccountMapPublisher publisher(nullptr, &negatives);
    timer.restart();
    publisher.publish();
    const double scratch = double(timer.nsecsElapsed()) / 1e6;
    const uint changed = firstUid + uint(count) / 2;
    writeRecord(changed, QStringLiteral("Changed"));
    timer.restart();
    publisher.publish();
    const double one = double(timer.nsecsElapsed()) / 1e6;
    FileVersion before = FileVersion::of(KestPaths::accountMapFile(), false);
    writeRecord(changed, QStringLiteral("Changed again"));
    timer.restart();
    const double watched = untilMapReplaced(timer, before);
    before = FileVersion::of(KestPaths::accountMapFile(), false);
    timer.restart();
    negatives.remember(QStringLiteral("@nobody"));
    publisher.negativeAnswersChanged();
    const double negative = untilMapReplaced(timer, before);
    // The settings file rewritten as it was: the whole folder is walked again, no record read.
    QFile settings(KestPaths::settingsFile());
    const QByteArray settingsText = settings.open(QIODevice::ReadOnly) ? settings.readAll() : QByteArray();
    settings.close();
    if (settings.open(QIODevice::WriteOnly | QIODevice::Truncate))
        settings.write(settingsText);
    settings.close();
    timer.restart();
    publisher.publish();
    const double walk = double(timer.nsecsElapsed()) / 1e6;
    notes << QStringLiteral("account map of %1 accounts: %2 bytes; laid out in %3 ms; built from scratch (a walk, "
                            "every record read) and written in %4 ms; after one record changed, %5 ms; a record "
                            "changed by another process shows %6 ms after the change, a new negative answer %7 ms "
                            "after it (%8 ms of settling included); after a change of the settings file (a walk, no "
                            "record read) %9 ms")
                 .arg(count)
                 .arg(QFileInfo(KestPaths::accountMapFile()).size())
                 .arg(layout, 0, 'f', 1)
                 .arg(scratch, 0, 'f', 1)
                 .arg(one, 0, 'f', 1)
                 .arg(watched, 0, 'f', 1)
                 .arg(negative, 0, 'f', 1)
                 .arg(AccountMapPublisher::settleMs)
                 .arg(walk, 0, 'f', 1);
    Q_UNUSED(bytes)
}

quint16 freePort()
{
    QTcpServer probe;
    return probe.listen(QHostAddress::LocalHost) ? probe.serverPort() : 0;
}

bool writeRecord(uint uid, const QString &gecos)
{
    static const QString digest = UserListManager::passwordDigest(QStringLiteral("pw"));
    const QString json = QStringLiteral(R"({"version":16777216,"uid":%1,"main_gid":10000,"account":"@user%1",)"
                                        R"("home_path":"/home/@user%1","login_shell":"/bin/bash","gecos":"%4",)"
                                        R"("password":"%2","last_login_time":%3})");
    CacheControlPtr record;
    return cacheRecordFromJson(record,
               json.arg(QString::number(uid), digest, QString::number(QDateTime::currentSecsSinceEpoch()), gecos))
        && saveCacheRecord(*record);
}

bool writeRecords(int count, uint firstUid)
{
    for (int i = 0; i < count; ++i) {
        if (!writeRecord(firstUid + uint(i), QStringLiteral("User ") + QString::number(firstUid + uint(i))))
            return false;
    }
    return true;
}

QDBusMessage userUid(uint uid)
{
    return QDBusMessage::createMethodCall(QStringLiteral("com.nimbal.kest.iam"),
               QStringLiteral("/com/nimbal/kest/iam/user") + QString::number(uid),
               QStringLiteral("org.freedesktop.DBus.Properties"), QStringLiteral("Get"))
        << QStringLiteral("com.nimbal.kest.iam.user") << QStringLiteral("Uid");
}

// dbus-kest from its start until the last per-user object answers, then logind's SessionNew.
QList<Row> frontServiceRows(int count, uint lastUid, QStringList &notes)
{
    const QString label = QStringLiteral(" (%1 records)").arg(count);
    PrivateBus bus;
    LogindStandIn logind;
    if (!bus.isRunning() || !logind.begin(bus.address())) {
        QTextStream(stderr) << "no private bus or logind stand-in: " << bus.errorText() << Qt::endl;
        return {};
    }
    const QString connectionName = QStringLiteral("bench-%1").arg(count);
    QDBusConnection connection = QDBusConnection::connectToBus(bus.address(), connectionName);
    QTemporaryDir guard;
    QProcess front;
    QProcessEnvironment environment = QProcessEnvironment::systemEnvironment();
    environment.insert(QStringLiteral("TMPDIR"), guard.path());
    front.setProcessEnvironment(environment);
    QElapsedTimer timer;
    timer.start();
    front.start(
        qEnvironmentVariable("KEST_TEST_BINARY_DIR") + QStringLiteral("/src/dbus-service/dbus-kest"), QStringList());
    while (connection.call(userUid(lastUid), QDBus::Block, 1000).type() != QDBusMessage::ReplyMessage
        && timer.elapsed() < 120000 && front.state() != QProcess::NotRunning)
        QThread::msleep(5);
    QList<Row> rows { { QStringLiteral("dbus-kest start until the last per-user object answers") + label,
        { double(timer.nsecsElapsed()) / 1e6 }, QString() } };
    QDBusMessage session = QDBusMessage::createMethodCall(QStringLiteral("com.nimbal.kest.iam"),
        QStringLiteral("/com/nimbal/kest/iam"), QStringLiteral("com.nimbal.kest.iam"), QStringLiteral("SessionNew"));
    session << QStringLiteral("c1")
            << QVariant::fromValue(QDBusObjectPath(QStringLiteral("/org/freedesktop/login1/session/c1")));
    rows << Row { QStringLiteral("dbus-kest SessionNew") + label,
        measure(5, [&] { connection.call(session, QDBus::Block, 120000); }), QString() };
    notes << QStringLiteral("dbus-kest RSS with %1 records: ").arg(count) + rssOf(front.processId());
    front.terminate();
    front.waitForFinished(30000);
    QDBusConnection::disconnectFromBus(connectionName);
    return rows;
}

// Both daemons over many cached accounts; the server is never reachable here.
QList<Row> scaleRows(int count, Floor &floor, QStringList &notes)
{
    const uint firstUid = 20000;
    TestRoot root;
    const quint16 port = freePort();
    root.writeSettings("[main]\nenable=true\nip=127.0.0.2\nport=" + QByteArray::number(port)
        + "\n[offline_login]\nenable=true\ncache_validity=30\n");
    if (!writeRecords(count, firstUid))
        return {};
    mapScale(count, firstUid, notes);
    const QList<quint32> listed = listCacheUids();
    const uint last = listed.isEmpty() ? firstUid : listed.last();
    QList<Row> rows = frontServiceRows(count, last, notes);

    const QString label = QStringLiteral(" (last of %1 records)").arg(count);
    CacheDaemonFixture daemon;
    QElapsedTimer timer;
    timer.start();
    const QByteArray group = call("queryGid", { QStringLiteral("1000"), QStringLiteral("{}") });
    if (!daemon.start() || !roundTrip(daemon.port(), group))
        return rows;
    rows << Row { QStringLiteral("cache-kest start until it answers (%1 records)").arg(count),
        { double(timer.nsecsElapsed()) / 1e6 }, QString() };
    const QString name = QStringLiteral("@user") + QString::number(last);
    const QByteArray lookUp = call("queryAccountName", { name });
    const QByteArray login = call("authenticatePassword", { name, QStringLiteral("pw") });
    roundTrip(daemon.port(), lookUp);
    rows << lookUpAndLogin(QStringLiteral("offline") + label, daemon.port(), lookUp, login, 200, floor);
    notes << QStringLiteral("cache-kest RSS with %1 records: ").arg(count) + rssOf(daemon.processId());
    return rows;
}

void print(const QList<Row> &rows, const QStringList &notes)
{
    QTextStream out(stdout);
    out << "machine: " << machine() << "\n\n";
    out << "| measurement | p50 ms | p90 ms | floor | p50 / floor | p90 / floor |\n|---|---|---|---|---|---|\n";
    for (const Row &row : rows) {
        const double p50 = percentile(row.samples, 0.5);
        const double p90 = percentile(row.samples, 0.9);
        out << "| " << row.name << " | " << QString::number(p50, 'f', 3) << " | " << QString::number(p90, 'f', 3)
            << " | ";
        const auto floor = std::find_if(rows.begin(), rows.end(), [&](const Row &r) { return r.name == row.floor; });
        if (floor == rows.end()) {
            out << "- | - | - |\n";
            continue;
        }
        out << floor->name << " | " << QString::number(p50 / percentile(floor->samples, 0.5), 'f', 2) << " | "
            << QString::number(p90 / percentile(floor->samples, 0.9), 'f', 2) << " |\n";
    }
    for (const QString &note : notes)
        out << "\n" << note;
    out << Qt::endl;
}
} // namespace

int main(int argc, char *argv[])
{
    splitCores();
    runOn(cores.server);
    QCoreApplication application(argc, argv);
    const int count = 200;
    TestRoot root;
    DomainServerFixture server;
    if (!server.isValid() || !server.start()) {
        QTextStream(stderr) << "cannot start the test domain server: " << server.errorText() << Qt::endl;
        return 1;
    }
    const QVariantMap settings { { QStringLiteral("main/enable"), true },
        { QStringLiteral("offline_login/enable"), true }, { QStringLiteral("offline_login/cache_validity"), 7 } };
    root.writeSettings(server.settingsIni(settings));
    root.writeFile(QStringLiteral("/usr/share/kest/machine.txt"), "bench-machine\n");
    CacheDaemonFixture daemon;
    if (!daemon.start()) {
        QTextStream(stderr) << "cannot start cache-kest: " << daemon.errorText() << Qt::endl;
        return 1;
    }
    const QByteArray lookUp = call("queryAccountName", { QStringLiteral("@alice") });
    const QByteArray login
        = call("authenticatePassword", { QStringLiteral("@alice"), QStringLiteral("alice-password") });
    QList<Row> rows;

    EchoServer echo;
    Floor loopback { { QStringLiteral("floor: framed loopback round trip to an echo process"), {}, QString() },
        [&] { roundTrip(echo.port(), lookUp); } };
    const DomainEndpoint endpoint = endpointOf(server);
    const QSslConfiguration tls = tlsOf(server);
    const QByteArray request = "GET /v1/domain/ HTTP/1.1\r\nHost: " + DomainServerFixture::address().toUtf8() + ':'
        + QByteArray::number(server.port()) + "\r\nContent-Length: 0\r\n\r\n";
    DomainConnection connection;
    connection.setEndpoint(endpoint, tls);
    const auto exchange
        = [&request](DomainConnection &over) { over.exchange(request, QDeadlineTimer(5000), QDeadlineTimer(5000)); };
    exchange(connection);
    Floor kept { { QStringLiteral("floor: HTTPS request, kept-alive connection"), {}, QString() },
        [&] { exchange(connection); } };
    rows << Row { QStringLiteral("floor: HTTPS request, new TLS connection"),
        measure(count / 4,
            [&] {
                DomainConnection once;
                once.setEndpoint(endpoint, tls);
                exchange(once);
            }),
        QString() };

    roundTrip(daemon.port(), login);
    rows << lookUpAndLogin(QStringLiteral("online"), daemon.port(), lookUp, login, count, kept);

    server.stop();
    // The online logins have just rewritten the record, and a record changed within the last 100 ms is read
    // again at each use: the offline rows measure the settled store.
    QThread::msleep(200);
    roundTrip(daemon.port(), lookUp);
    rows << lookUpAndLogin(QStringLiteral("offline"), daemon.port(), lookUp, login, count, loopback);
    const QString rss = rssOf(daemon.processId());
    rows << moduleRows(loopback);
    QStringList mapNotes;
    server.start(server.port());
    // The daemon counts the server out of reach since it stopped, until its next probe (once a second).
    QThread::msleep(1500);
    server.clearRequests();
    rows << mapRows(QStringLiteral("map, daemon running: "), loopback, daemon.processId(), mapNotes);
    mapNotes << QStringLiteral("requests reaching the domain server during the map rows: %1 (1: the first look-up "
                               "of the unknown name alone)")
                    .arg(server.requests().size());
    server.stop();

    // A new outage per daemon start: the first call finds the server silent, the others know it.
    Row first { QStringLiteral("look-up, server blackholed: first call"), {}, loopback.row.name };
    Row following { QStringLiteral("look-up, server blackholed: following calls"), {}, loopback.row.name };
    Blackhole blackhole(DomainServerFixture::address(), server.port());
    for (int run = 0; run < 3 && blackhole.isFull(); ++run) {
        daemon.stop();
        daemon.start();
        first.samples << measure(1, [&] { roundTrip(daemon.port(), lookUp); });
        following.samples << measure(
            count / 3, [&] { roundTrip(daemon.port(), lookUp); }, &loopback);
    }
    rows << first << following;
    daemon.stop();
    rows << mapRows(QStringLiteral("map, daemon stopped: "), loopback, 0, mapNotes);
    QStringList notes { QStringLiteral("cache-kest RSS after the online and offline rows: ") + rss,
        QStringLiteral("blackholed first call: p50 %1 s over %2 daemon starts")
            .arg(percentile(first.samples, 0.5) / 1000, 0, 'f', 2)
            .arg(first.samples.size()) };
    notes << mapNotes;
    for (const int count : { 1000, 10000 })
        rows << scaleRows(count, loopback, notes);
    rows.prepend(kept.row);
    rows.prepend(loopback.row);
    print(rows, notes);
    return 0;
}
