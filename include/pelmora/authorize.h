#pragma once
// Authorisation: privileges, roles, access-control lists, the manager that answers
// checks from per-user caches, and the providers it is built on (POSIX users and
// groups, SQLite storage, an entity tree the program fills).

#include "pelmora/authorize/acl.h"
#include "pelmora/authorize/authorizeManager.h"
#include "pelmora/authorize/entityTree.h"
#include "pelmora/authorize/exceptions.h"
#include "pelmora/authorize/posixUserDirectory.h"
#include "pelmora/authorize/privileges.h"
#include "pelmora/authorize/providers.h"
#include "pelmora/authorize/roles.h"
#include "pelmora/authorize/sqliteStorage.h"
