// A second process for the case vault tests.
//   write DIR: adds cases, each with one item, and prints "case ID" / "item ID" after each call
//              returned, until it is killed (or after many rounds).
//   dump DIR:  writes dumpCaseVault of a fresh instance to standard output (QDataStream).

#include "CaseDatabase.h"
#include "CaseVaultDump.h"

#include <QCoreApplication>
#include <QDataStream>
#include <QFile>
#include <cstdio>

int main(int argc, char** argv)
{
    QCoreApplication app(argc, argv); // the SQL driver is a plug-in, found through the application
    const QStringList args = app.arguments();
    if (args.size() != 3) {
        return 2;
    }
    CaseDatabase vault(args.at(2));
    if (args.at(1) == QLatin1String("write")) {
        for (int round = 0; round < 100000; ++round) {
            const int caseId = vault.addCase(QStringLiteral("case %1").arg(round),
                                             QStringLiteral("%1").arg(round), QStringLiteral("probe"));
            std::printf("case %d\n", caseId);
            std::fflush(stdout);
            const QVariantMap item{{"startTimestamp", qint64(round) * 1000 + 1},
                                   {"endTimestamp", qint64(round) * 1000 + 500},
                                   {"objImage", QStringLiteral("image %1").arg(round)}};
            std::printf("item %d\n", vault.addCaseItem(caseId, item));
            std::fflush(stdout);
        }
        return 0;
    }
    if (args.at(1) == QLatin1String("dump")) {
        QFile out;
        if (!out.open(stdout, QIODevice::WriteOnly)) {
            return 1;
        }
        QDataStream stream(&out);
        stream << dumpCaseVault(vault);
        return 0;
    }
    return 2;
}
