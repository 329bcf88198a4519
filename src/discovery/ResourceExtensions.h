#pragma once
// Read tokens for the resources a plug-in shares with its hosts ("Shared":
// paths relative to its bundle; "." is the bundle itself), put into the
// plug-in's form under "extensions". A shared path whose canonical form
// leaves the bundle (through ".." or a symbolic link) gets no token.

#include "platform/value/Value.h"
#include "registry/QMDPlugIn.h"

// `issueResourceExtensions:`: each shared path to its token; failures are
// logged and left out. Never none.
qm::Dictionary issueResourceExtensions(const QMDPlugIn& plugIn, const qm::Value& shared);
// `augmentForm:`: sets the form's "extensions" when the plug-in shares anything.
void augmentForm(const QMDPlugIn& plugIn, qm::Dictionary& form);
