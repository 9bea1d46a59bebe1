#include "localshare/Corpus.h"

namespace vtc::local {

std::string peerCard(int i, int edit) {
  const std::string n = std::to_string(i);
  std::string note =
      "Met at the conference in spring; prefers e-mail in the morning and calls after six. "
      "Knows the whole team from the old project and lends books gladly. Edit " +
      std::to_string(edit) + ".";
  std::string folded =
      "NOTE:" + note.substr(0, 70) + "\r\n " + note.substr(70, 74) + "\r\n " + note.substr(144);
  return "BEGIN:VCARD\r\nVERSION:3.0\r\nUID:person-" + n + "@example.org\r\nFN:Person Number " + n +
         "\r\nN:Number;Person;" + n + ";;\r\nEMAIL;TYPE=INTERNET,WORK:person." + n +
         "@example.org\r\nTEL;TYPE=CELL:+1 555 01" + n + "\r\nADR;TYPE=HOME:;;" + n +
         " Long Street;Springfield;ST;12345;Country\r\nORG:Example "
         "Works;Research\r\nTITLE:Engineer\r\n" +
         folded + "\r\nEND:VCARD\r\n";
}

}  // namespace vtc::local
