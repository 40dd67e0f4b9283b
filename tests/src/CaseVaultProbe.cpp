// A second process for the case vault tests.
//   write DIR: adds cases, each with one item, and prints "case ID" / "item ID" after each call
//              returned, until it is killed (or after many rounds).
//   dump DIR:  writes dumpCaseVault of a fresh instance to standard output (QDataStream).
//   full DIR:  adds a few cases, then keeps adding under a file-size limit at the vault's size
//              (a full disk: writes past it fail with EFBIG), then lifts the limit and adds one
//              more. Prints "case ID ROUND" / "item ID CASE ROUND" (ID 0: refused) and
//              "read CASE COUNT" for reads made while full.

#include "CaseDatabase.h"
#include "CaseVaultDump.h"

#include <QCoreApplication>
#include <QDataStream>
#include <QFile>
#include <QFileInfo>
#include <csignal>
#include <cstdio>
#include <sys/resource.h>

namespace {

// One case with one item whose image is large enough that a few rounds need new pages.
void addRound(CaseDatabase& vault, int round)
{
    const int caseId = vault.addCase(QStringLiteral("full case %1").arg(round),
                                     QStringLiteral("%1").arg(round), QStringLiteral("probe"));
    std::printf("case %d %d\n", caseId, round);
    const QVariantMap item{
        {"startTimestamp", qint64(round) * 1000 + 1},
        {"endTimestamp", qint64(round) * 1000 + 500},
        {"objImage", QStringLiteral("image %1 ").arg(round) + QString(3000, QLatin1Char('x'))}};
    std::printf("item %d %d %d\n", caseId > 0 ? vault.addCaseItem(caseId, item) : 0, caseId, round);
    std::fflush(stdout);
}

int fill(CaseDatabase& vault, const QString& file)
{
    int round = 0;
    for (; round < 3; ++round) {
        addRound(vault, round);
    }
    rlimit unlimited{};
    if (::getrlimit(RLIMIT_FSIZE, &unlimited) != 0) {
        return 1;
    }
    std::signal(SIGXFSZ, SIG_IGN);
    const rlimit full{rlim_t(QFileInfo(file).size()), unlimited.rlim_max};
    if (::setrlimit(RLIMIT_FSIZE, &full) != 0) {
        return 1;
    }
    for (int refused = 0; refused < 5 && round < 200; ++round) {
        const int before = int(vault.getAllCase().size());
        addRound(vault, round);
        refused = int(vault.getAllCase().size()) == before ? refused + 1 : 0;
        std::printf("read %d %d\n", 1, int(vault.getCaseItemList(1).size()));
    }
    if (::setrlimit(RLIMIT_FSIZE, &unlimited) != 0) {
        return 1;
    }
    addRound(vault, round);
    return 0;
}

} // namespace

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
    if (args.at(1) == QLatin1String("full")) {
        return fill(vault, args.at(2) + QStringLiteral("/PluginDelvix/CaseVault.db"));
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
