#include "cache-common.h"
#include "syslogcapture.h"

#include <QTest>

#include <dlfcn.h>

class NssLoaderTest : public QObject
{
    Q_OBJECT

private Q_SLOTS:
    void load_data()
    {
        QTest::addColumn<QByteArray>("service");
        QTest::addColumn<QByteArray>("suffix");
        QTest::addColumn<bool>("loads");
        QTest::newRow("files, empty suffix") << QByteArray("files") << QByteArray("") << true;
        QTest::newRow("files, .2") << QByteArray("files") << QByteArray(".2") << true;
        QTest::newRow("files, wrong suffix") << QByteArray("files") << QByteArray(".7") << false;
        QTest::newRow("no such service") << QByteArray("kestnone") << QByteArray() << false;
    }

    void load()
    {
        QFETCH(QByteArray, service);
        QFETCH(QByteArray, suffix);
        QFETCH(bool, loads);
        SyslogCapture::clear();
        nss_function_entry table[NSS_FUNCTION_COUNT] = {};

        void *handle = load_nss_library(service.constData(), suffix.isNull() ? nullptr : suffix.constData(), table);
        QCOMPARE(handle != nullptr, loads);
        if (!loads) {
            QCOMPARE(SyslogCapture::lines().size(), 1);
            QVERIFY(SyslogCapture::lines().first().text.contains(
                ", src/c-common/cache-common, 38, load_nss_library, critical error! cound not find libnss_files.so."));
            return;
        }
        // Calls through the table are the group list test's; it never uses these entries.
        QCOMPARE(QByteArray(table[NSS_GETSGENT_R].name), QByteArray("_nss_files_getsgent_r"));
        QCOMPARE(QByteArray(table[NSS_INITGROUPS_DYN].pattern), QByteArray("_nss_%s_initgroups_dyn"));
        QVERIFY(SyslogCapture::lines().isEmpty());
        dlclose(handle);
    }
};

QTEST_GUILESS_MAIN(NssLoaderTest)
#include "test_nssloader.moc"
