// Tables: creation around the cursor registry's close-all and restore-all, best-effort drop.
#include <kovpager/KovBtree.h>

#include <string>
#include <vector>

#include "engine/btree.h"

namespace eng = kov::engine;

namespace {

// Engine flags of each table kind; any kind other than 0 and 1 is a key-only table.
std::uint32_t flagsOf(KovBtree::TableType type) {
    if (type == KovBtree::BlobTable)
        return 0;
    if (type == KovBtree::IntKeyTable)
        return eng::BTREE_INTKEY | eng::BTREE_LEAFDATA;
    return eng::BTREE_ZERODATA;
}

}  // namespace

KovBtree::KovBtree(TableType type) : pager_(KovPager::instance()), rootPage_(0), tableFlags_(0) {
    if (pager_->openEngine() == nullptr)
        pager_->initialize();
    tableFlags_ = flagsOf(type);
    rootPage_ = 0;
    // The engine creates no table while a cursor is open: close them all around the creation.
    std::vector<std::string> saved;
    pager_->closeAllCursors(saved);
    eng::sqlite3BtreeCreateTable(pager_->engine_, &rootPage_, static_cast<int>(tableFlags_));
    pager_->restoreAllCursors(saved);
}

KovBtree::~KovBtree() {
    // Refused by the engine while any cursor is open: the table then stays until the engine closes.
    if (pager_->openEngine() != nullptr) {
        int moved = 0;
        eng::sqlite3BtreeDropTable(pager_->engine_, rootPage_, &moved);
    }
}
