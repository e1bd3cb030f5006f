#include "unix/audit.h"

oxAuditFile& theAudit() {
    static oxAuditFile& audit = [&]() -> oxAuditFile& {
        auto* made = new oxAuditFile;
        oxAuditFile::SetDefaultAudit(made);
        return *made;
    }();
    return audit;
}
