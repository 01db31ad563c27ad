#include "cache-common.h"
#include "syslogcapture.h"

#include <QTest>

#include <dlfcn.h>

class NssLoaderTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    // An empty suffix falls back to the versioned name as a missing one does; a given one is taken as it is.
    void load()
    {
        nss_function_entry table[NSS_FUNCTION_COUNT] = {};
        for (const char *suffix : { "", ".2" }) {
            void *handle = load_nss_library("files", suffix, table);
            QVERIFY2(handle, suffix);
            dlclose(handle);
        }
        // Calls through the table are the group list test's; it never uses these entries.
        QCOMPARE(QByteArray(table[NSS_GETSGENT_R].name), QByteArray("_nss_files_getsgent_r"));
        QCOMPARE(QByteArray(table[NSS_INITGROUPS_DYN].pattern), QByteArray("_nss_%s_initgroups_dyn"));
        QVERIFY(SyslogCapture::lines().isEmpty());
        QVERIFY(!load_nss_library("files", ".7", table));
        QVERIFY(!load_nss_library("kestnone", nullptr, table));
        QCOMPARE(
            SyslogCapture::count(
                ", src/c-common/cache-common, 38, load_nss_library, critical error! cound not find libnss_files.so."),
            2);
    }
};

QTEST_GUILESS_MAIN(NssLoaderTest)
#include "test_nssloader.moc"
