#include "quarn_d_restore/app_restore.h"

#include <algorithm>
#include <utility>
#include <vector>

#include "quarn_d_restore/archive_download.h"
#include "quarn_d_restore/cloud_restore.h"
#include "quarn_d_restore/companion_restore.h"
#include "quarn_d_restore/hidden_icon.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/restore_context.h"
#include "quarn_d_restore/restore_mode.h"
#include "quarn_d_utils/icon.h"

namespace {

/** What was left to the engine, until its restore has ended. */
std::vector<RestoreContextPtr> left;

auto place_of(const pkg_restore_context *ctx) {
  return std::find_if(left.begin(), left.end(),
                      [ctx](const RestoreContextPtr &one) { return one.get() == ctx; });
}

/** Null for one that its owner waits for. */
RestoreContextPtr take_left(const pkg_restore_context *ctx) {
  const auto place = place_of(ctx);
  if (place == left.end()) return nullptr;
  RestoreContextPtr own = std::move(*place);
  left.erase(place);
  return own;
}

}  // namespace

int restore_app_data(const char * /*appid*/, pkg_restore_context *ctx) {
  recover_interrupted_restore(ctx->pkgid.c_str(), ctx->root.c_str());
  return current_restore_client == QUARN_CLIENT_CLOUD ? restore_from_cloud(ctx)
                                                      : restore_from_companion(ctx);
}

void leave_restore(RestoreContextPtr ctx) { left.push_back(std::move(ctx)); }

void abandon_restore(RestoreContextPtr ctx) {
  const pkg_restore_context *const abandoned = ctx.get();
  leave_restore(std::move(ctx));
  abort_download_of(abandoned);
}

bool is_abandoned(const pkg_restore_context &ctx) {
  return ctx.wait_for_result && place_of(&ctx) != left.end();
}

void check_package_restore_complete(pkg_restore_context *ctx) {
  if (--ctx->pending != 0) return;
  const RestoreContextPtr own = take_left(ctx);
  if (!ctx->wait_for_result) {
    appear_app_icon(ctx->pkgid.c_str(), true, 0.0);
    forget_hidden_icon(ctx->pkgid.c_str(), ctx->root.c_str());
  } else if (ctx->main_loop != nullptr) {
    // The request has a reference of its own.
    GMainLoop *const loop = ctx->main_loop.get();
    ctx->main_loop.reset();
    g_main_loop_quit(loop);
  }
}
