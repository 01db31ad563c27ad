#include "nssmodule.h"

#include "wrappedcommand.h"

#include <QByteArrayList>
#include <QString>

#include <grp.h>
#include <pwd.h>

NssModule::NssModule()
    : m_handle(dlopen(WrappedCommand::modulePath("libnss_kest.so.2").constData(), RTLD_NOW | RTLD_LOCAL))
{
    if (!m_handle)
        m_error = dlerror();
}

NssModule::~NssModule()
{
    if (m_handle)
        dlclose(m_handle);
}

QByteArray NssModule::call(const QByteArray &function, const QByteArray &key, size_t bufferSize) const
{
    QByteArray buffer(int(bufferSize), '\0'), entry;
    int error = 0, status;
    passwd pwd {};
    group grp {};
    long start = 1, room = 1;
    auto *groups = static_cast<gid_t *>(malloc(sizeof(gid_t)));
    groups[0] = 10000;
    if (function == "getpwnam")
        status = entryPoint("_nss_kest_getpwnam_r", key.constData(), &pwd, buffer.data(), bufferSize, &error);
    else if (function == "getpwuid")
        status = entryPoint("_nss_kest_getpwuid_r", uid_t(key.toUInt()), &pwd, buffer.data(), bufferSize, &error);
    else if (function == "getgrnam")
        status = entryPoint("_nss_kest_getgrnam_r", key.constData(), &grp, buffer.data(), bufferSize, &error);
    else
        status
            = entryPoint("_nss_kest_initgroups_dyn", key.constData(), gid_t(10000), &start, &room, &groups, 0L, &error);
    if (status == NSS_STATUS_SUCCESS && pwd.pw_name)
        entry = QByteArrayList({ pwd.pw_name, pwd.pw_passwd, QByteArray::number(pwd.pw_uid),
                                   QByteArray::number(pwd.pw_gid), pwd.pw_gecos, pwd.pw_dir, pwd.pw_shell })
                    .join(':');
    if (status == NSS_STATUS_SUCCESS && grp.gr_name) {
        entry = QString::asprintf("%s:%s:%u:", grp.gr_name, grp.gr_passwd, grp.gr_gid).toUtf8();
        for (char **member = grp.gr_mem; *member; ++member)
            entry += QByteArray(*member) + (member[1] ? "," : "");
    }
    for (long i = 0; function == "initgroups" && i < start; ++i)
        entry += QByteArray::number(groups[i]) + ' ';
    free(groups);
    return (QByteArray::number(status) + ' ' + QByteArray::number(error) + ' ' + entry).trimmed();
}
