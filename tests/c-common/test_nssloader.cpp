#include "cache-common.h"
#include "syslogcapture.h"

#include <QTest>

#include <cstring>
#include <dlfcn.h>
#include <grp.h>
#include <nss.h>

namespace {
using GetGrNam = enum nss_status (*)(const char *, struct group *, char *, size_t, int *);
}

class NssLoaderTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void init() { SyslogCapture::clear(); }

    void loadsFilesModule_data()
    {
        QTest::addColumn<QByteArray>("suffix");
        QTest::newRow("no suffix") << QByteArray();
        QTest::newRow("empty suffix") << QByteArray("");
        QTest::newRow("explicit .2") << QByteArray(".2");
    }

    void loadsFilesModule()
    {
        QFETCH(QByteArray, suffix);
        nss_function_entry table[NSS_FUNCTION_COUNT] = {};
        void *handle = load_nss_library("files", suffix.isNull() ? nullptr : suffix.constData(), table);
        QVERIFY(handle != nullptr);
        QCOMPARE(QByteArray(table[NSS_GETGRNAM_R].name), QByteArray("_nss_files_getgrnam_r"));
        QCOMPARE(QByteArray(table[NSS_GETSGENT_R].name), QByteArray("_nss_files_getsgent_r"));
        QCOMPARE(QByteArray(table[NSS_INITGROUPS_DYN].pattern), QByteArray("_nss_%s_initgroups_dyn"));
        QVERIFY(table[NSS_GETPWNAM_R].function != nullptr);

        auto getgrnam = reinterpret_cast<GetGrNam>(table[NSS_GETGRNAM_R].function);
        QVERIFY(getgrnam != nullptr);
        struct group result;
        char buffer[8192];
        int error = 0;
        QCOMPARE(int(getgrnam("root", &result, buffer, sizeof(buffer), &error)), int(NSS_STATUS_SUCCESS));
        QCOMPARE(QByteArray(result.gr_name), QByteArray("root"));
        QCOMPARE(result.gr_gid, gid_t(0));
        QVERIFY(int(getgrnam("no-such-group-here", &result, buffer, sizeof(buffer), &error)) < 1);
        QVERIFY(SyslogCapture::lines().isEmpty());
        dlclose(handle);
    }

    void missingModule_data()
    {
        QTest::addColumn<QByteArray>("service");
        QTest::addColumn<QByteArray>("suffix");
        QTest::newRow("unknown service") << QByteArray("kestnone") << QByteArray();
        QTest::newRow("files with wrong suffix") << QByteArray("files") << QByteArray(".7");
    }

    void missingModule()
    {
        QFETCH(QByteArray, service);
        QFETCH(QByteArray, suffix);
        nss_function_entry table[NSS_FUNCTION_COUNT];
        memset(table, 0x5a, sizeof(table));
        nss_function_entry before[NSS_FUNCTION_COUNT];
        memcpy(before, table, sizeof(table));

        QVERIFY(load_nss_library(service.constData(), suffix.isNull() ? nullptr : suffix.constData(), table)
                == nullptr);
        QCOMPARE(memcmp(before, table, sizeof(table)), 0);
        const QList<SyslogLine> lines = SyslogCapture::lines();
        QCOMPARE(lines.size(), 1);
        QCOMPARE(lines.first().priority, 3);
        QVERIFY(lines.first().text.contains(
            ", src/c-common/cache-common, 38, load_nss_library, critical error! cound not find libnss_files.so."));
    }
};

QTEST_GUILESS_MAIN(NssLoaderTest)
#include "test_nssloader.moc"
