// The virtual operations keep their places: programs that were built against an older library call by them. A class
// that derives adds its own behind those of its base.
#include <gtest/gtest.h>

#include <type_traits>
#include <vector>

#include "app/oxxhttpserver.h"
#include "proc.h"
#include "resources/resource.h"
#include "resources/script.h"
#include "resources/staticfile.h"
#include "rwlock.h"
#include "support/auditfile.h"
#include "testing/slots.h"
#include "users/authenticate.h"
#include "users/osuserbase.h"
#include "users/oxuserbase.h"

namespace {
constexpr std::size_t BEHIND_DESTRUCTOR = 2;

void ExpectRow(std::size_t first, const std::vector<std::size_t>& places) {
    for (const std::size_t place : places)
        EXPECT_EQ(first++, place);
}

template <typename Class>
std::vector<std::size_t> UserBaseOperations() {
    return {SlotOf(&Class::Authenticate),   SlotOf(&Class::AddUser),           SlotOf(&Class::DeleteUser),
            SlotOf(&Class::SetPermissions), SlotOf(&Class::SetPassword),       SlotOf(&Class::SetText1),
            SlotOf(&Class::SetText2),       SlotOf(&Class::GetPermissionsText)};
}
}  // namespace

TEST(VirtualOrder, ServersAddTheirOperationsLayerByLayer) {
    static_assert(std::is_base_of_v<MThread, oxHttpDaemon> && std::is_base_of_v<oxHttpDaemon, oxHttpServer> &&
                  std::is_base_of_v<oxHttpServer, oxAuthenticatedHttpServer> &&
                  std::is_base_of_v<oxAuthenticatedHttpServer, oxScriptingHttpServer> &&
                  std::is_base_of_v<oxScriptingHttpServer, oxxHttpServer>);
    EXPECT_TRUE(std::has_virtual_destructor_v<MThread>);
    ExpectRow(BEHIND_DESTRUCTOR,
              {SlotOf(&oxHttpDaemon::StartDaemon), SlotOf(&oxHttpServer::Start), SlotOf(&oxHttpServer::CreateResource),
               SlotOf(&oxHttpServer::Terminate), SlotOf(&oxHttpServer::Shutdown),
               SlotOf(&oxAuthenticatedHttpServer::AuthenticateRequest),
               SlotOf(&oxAuthenticatedHttpServer::StartAuthenticated),
               SlotOf(&oxAuthenticatedHttpServer::AuthenticateUser), SlotOf(&oxxHttpServer::GetScriptsDirectory)});
    EXPECT_EQ(SlotOf(&oxHttpServer::Shutdown), SlotOf(&oxAuthenticatedHttpServer::Shutdown));
    EXPECT_EQ(SlotOf(&oxHttpServer::CreateResource), SlotOf(&oxxHttpServer::CreateResource));
    EXPECT_EQ(SlotOf(&oxAuthenticatedHttpServer::AuthenticateUser), SlotOf(&oxxHttpServer::AuthenticateUser));
}

TEST(VirtualOrder, Resources) {
    EXPECT_TRUE(std::has_virtual_destructor_v<oxResource>);
    ExpectRow(BEHIND_DESTRUCTOR, {SlotOf(&oxResource::GetReply)});
    ExpectRow(BEHIND_DESTRUCTOR, {SlotOf(&oxResource_Invalid::GetReply)});
    ExpectRow(BEHIND_DESTRUCTOR, {SlotOf(&oxResource_StaticFile::GetReply)});
    ExpectRow(BEHIND_DESTRUCTOR, {SlotOf(&oxResource_Script::GetReply)});
}

TEST(VirtualOrder, AuditFile) {
    using A = oxAuditFile;
    EXPECT_TRUE(std::has_virtual_destructor_v<A>);
    ExpectRow(BEHIND_DESTRUCTOR,
              {SlotOf(&A::Open), SlotOf(&A::Close), SlotOf(&A::Write), SlotOf<void(const char*, ...)>(&A::Printf),
               SlotOf<void(int, const char*, ...)>(&A::Printf), SlotOf(&A::Error), SlotOf(&A::Stamp),
               SlotOf(&A::IsOpen), SlotOf<A&(const A&)>(&A::operator=), SlotOf(&A::Attach)});
}

TEST(VirtualOrder, Users) {
    using U = oxUser;
    EXPECT_TRUE(std::has_virtual_destructor_v<U>);
    ExpectRow(BEHIND_DESTRUCTOR, {SlotOf(&U::SetPermissions), SlotOf(&U::GetPermissions), SlotOf(&U::IsExpired),
                                  SlotOf(&U::GetAttribute), SlotOf(&U::SetAttribute), SlotOf(&U::Touch)});
}

TEST(VirtualOrder, UserBases) {
    EXPECT_TRUE(std::has_virtual_destructor_v<UserBase>);
    ExpectRow(BEHIND_DESTRUCTOR, UserBaseOperations<UserBase>());
    ExpectRow(BEHIND_DESTRUCTOR, UserBaseOperations<OSUserBase>());
    auto own = UserBaseOperations<oxUserBase>();
    own.push_back(SlotOf(&oxUserBase::AllowsAnonymousUser));
    ExpectRow(BEHIND_DESTRUCTOR, own);
}

TEST(VirtualOrder, AuthenticatorsHaveTheirDestructorLast) {
    EXPECT_TRUE(std::has_virtual_destructor_v<oxAuthenticate>);
    EXPECT_EQ(0u, SlotOf(&oxAuthenticate::Authenticate));
}

TEST(VirtualOrder, LocksAndChildProcesses) {
    using L = RWLock;
    ExpectRow(BEHIND_DESTRUCTOR, {SlotOf<int()>(&L::ReadLock), SlotOf(&L::ReadTryLock), SlotOf<int()>(&L::ReadUnlock),
                                  SlotOf<int()>(&L::WriteLock), SlotOf(&L::WriteTryLock),
                                  SlotOf<int()>(&L::WriteUnlock), SlotOf(&L::LastError)});
    using P = oxProc;
    ExpectRow(BEHIND_DESTRUCTOR, {SlotOf(&P::Spawn), SlotOf<int(std::uint32_t)>(&P::Wait), SlotOf(&P::Terminate),
                                  SlotOf(&P::Kill), SlotOf(&P::GetErrorText)});
}
