#include "client/merge/IncomingFold.h"

#include "client/merge/RecordMerge.h"

namespace vtc::client::merge {

void foldChange(FoldState& state, const SyncEngineChange& change, const std::string& origin,
                bool here) {
  state.changed = true;
  state.origin = origin;
  auto noteRestore = [&] {
    if (!state.buried) return;
    state.restored = true;
    state.restoredDeletedBy = state.deletedBy;
    state.restoredDeleteWasHere = state.deletedHere;
    state.buried.reset();
  };
  switch (change.type()) {
    case SyncEngineChange::kDelete:
      if (state.record) {
        state.buried = std::move(state.record);
        state.record.reset();
        state.deletedBy = origin;
        state.deletedHere = here;
      }
      state.restored = false;
      return;
    case SyncEngineChange::kAdd: {
      Dictionary record;
      applyChanges(record, change.changes());
      if (!state.record) noteRestore();
      state.record = std::move(record);
      state.partial = false;
      return;
    }
    default:  // a modify
      if (!state.record) {
        if (state.buried) {
          state.record = *state.buried;
          noteRestore();
        } else {
          state.record.emplace();
          state.partial = true;
        }
      }
      applyChanges(*state.record, change.changes());
      return;
  }
}

}  // namespace vtc::client::merge
