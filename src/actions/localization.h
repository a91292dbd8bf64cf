// Message localization for the mail actions: the language of a recipient address, and the
// translation of a rule's text through a localization bundle. Runs only on the processing
// queue: the domain table and both caches are process-wide, filled on first use and never
// cleared, so a bundle changed on disk is read again only after a restart.
#pragma once

#include <string>

namespace tarvod {

// The address's language: its prefix (the text before the first ":" when that is at most
// three characters long), which is removed from *address with its colon; else the language
// of its top-level domain; else "en". Never empty.
std::string AddressLanguage(std::string* address);

// text translated into language through the bundle at bundlePath and its strings table
// (empty: "Localizable"); text unchanged when any of them is empty or nothing applies.
std::string LocalizeText(const std::string& text, const std::string& language,
                         const std::string& bundlePath, const std::string& table);

}  // namespace tarvod
