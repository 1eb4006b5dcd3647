// Everything a client of quarterd needs: the connection, typed requests and
// replies, container classes and result codes.
#pragma once

#include <quarterkit/Connection.h>
#include <quarterkit/Errors.h>
#include <quarterkit/PlistValue.h>
#include <quarterkit/Requests.h>
#include <quarterkit/UUID.h>
