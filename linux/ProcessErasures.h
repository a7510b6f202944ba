#pragma once

namespace quarvel {

/// Carries out what `quarvelctl erase` asks for, from now on and what was asked for before: a file
/// `<name>.json` in the directory erase/ of the runtime directory, `{"session": ID}`,
/// `{"before": microseconds}` or `{"all": true}`, and the notification "tarnwick.quarvel.erase". It
/// becomes `<name>.answer`: `{"rows": N}` or `{"error": "..."}`. While rows are erased nothing is
/// exported and no exporter has one in its hands. To be called once, after the store was opened.
void AnswerErasureRequests();

}  // namespace quarvel
