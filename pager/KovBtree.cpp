// Tables: creation through the cursor registry (every cursor closed around it), best-effort drop.
#include <kovpager/KovBtree.h>

#include "engine/btree.h"
#include "pager/CursorRegistry.h"

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
    // The engine creates no table while a cursor is open: the registry closes them all around
    // the creation.
    rootPage_ = kov::pager::CursorRegistry::createTable(*pager_, tableFlags_);
}

KovBtree::~KovBtree() {
    // Refused by the engine while any cursor is open: the table then stays until the engine closes.
    if (pager_->openEngine() != nullptr) {
        int moved = 0;
        eng::sqlite3BtreeDropTable(pager_->engine_, rootPage_, &moved);
    }
}
