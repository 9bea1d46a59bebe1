// The peer benchmark's address book: vCards of about 470 bytes, each with a
// name, e-mail, phone, address, organisation, title, a folded note and a
// UID of its own. The tests use the same cards.
#pragma once

#include <string>

namespace vtc::local {

// Card i ("person-<i>@example.org", "Person Number <i>") at its edit'th
// version (the note says which).
std::string peerCard(int i, int edit);

}  // namespace vtc::local
