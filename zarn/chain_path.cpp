#include "zarn/chain_path.h"

namespace yomber {

std::string pathOfChain(const TreeLayout& layout, const ItemChain& chain, Names names) {
  std::string path = chain.place == kTrashID ? layout.trashFiles() : layout.root();
  for (auto row = chain.rows.rbegin(); row != chain.rows.rend(); ++row) {
    if (row->isContainerFolder()) {
      path = layout.documents(row->extra->containerID);
      continue;
    }
    path += '/';
    path += names == Names::OnDisk ? row->nameOnDisk() : row->name;
  }
  return path;
}

}  // namespace yomber
