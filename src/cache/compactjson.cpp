#include "compactjson.h"

namespace
{
// The longest form of one UTF-16 unit: \uXXXX.
const int longestPerUnit = 6;

char *escaped(char *out, uint unit)
{
    *out++ = '\\';
    *out++ = 'u';
    for (int shift = 12; shift >= 0; shift -= 4)
        *out++ = "0123456789abcdef"[(unit >> shift) & 0xf];
    return out;
}

char *ascii(char *out, char16_t unit)
{
    const char *shortForm = nullptr;
    switch (unit) {
    case u'"':
        shortForm = "\\\"";
        break;
    case u'\\':
        shortForm = "\\\\";
        break;
    case u'\b':
        shortForm = "\\b";
        break;
    case u'\f':
        shortForm = "\\f";
        break;
    case u'\n':
        shortForm = "\\n";
        break;
    case u'\r':
        shortForm = "\\r";
        break;
    case u'\t':
        shortForm = "\\t";
        break;
    }
    if (shortForm) {
        *out++ = shortForm[0];
        *out++ = shortForm[1];
        return out;
    }
    if (unit < 0x20)
        return escaped(out, unit);
    *out++ = char(unit);
    return out;
}

char *utf8(char *out, uint code)
{
    if (code < 0x800) {
        *out++ = char(0xc0 | (code >> 6));
    } else if (code < 0x10000) {
        *out++ = char(0xe0 | (code >> 12));
        *out++ = char(0x80 | ((code >> 6) & 0x3f));
    } else {
        *out++ = char(0xf0 | (code >> 18));
        *out++ = char(0x80 | ((code >> 12) & 0x3f));
        *out++ = char(0x80 | ((code >> 6) & 0x3f));
    }
    *out++ = char(0x80 | (code & 0x3f));
    return out;
}
} // namespace

void CompactJson::append(QByteArray &out, const QString &text)
{
    const int start = out.size();
    out.resize(start + text.size() * longestPerUnit + 2);
    char *cursor = out.data() + start;
    *cursor++ = '"';
    const QChar *const end = text.constEnd();
    for (const QChar *c = text.constBegin(); c != end; ++c) {
        const char16_t unit = c->unicode();
        if (unit < 0x80) {
            cursor = ascii(cursor, unit);
        } else if (c->isHighSurrogate() && c + 1 != end && c[1].isLowSurrogate()) {
            cursor = utf8(cursor, QChar::surrogateToUcs4(*c, c[1]));
            ++c;
        } else if (c->isSurrogate()) {
            // A surrogate without its other half has no UTF-8 form.
            cursor = escaped(cursor, unit);
        } else {
            cursor = utf8(cursor, unit);
        }
    }
    *cursor++ = '"';
    out.resize(int(cursor - out.constData()));
}
