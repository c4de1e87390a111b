################################################################################
#
# migrate-settings
#
################################################################################

MIGRATE_SETTINGS_VERSION = 0.1.0
# Built from the checkout that holds this external tree; a release build
# sets MIGRATE_SETTINGS_SITE to where its tarball lies (and its hash goes
# into migrate-settings.hash).
MIGRATE_SETTINGS_SITE = $(realpath $(BR2_EXTERNAL_MIGRATE_SETTINGS_PATH)/../..)
MIGRATE_SETTINGS_SITE_METHOD = local
MIGRATE_SETTINGS_OVERRIDE_SRCDIR_RSYNC_EXCLUSIONS = --exclude build
MIGRATE_SETTINGS_LICENSE = PROPRIETARY
MIGRATE_SETTINGS_INSTALL_STAGING = YES

# cmake-package configures with BUILD_TESTING=OFF, BUILD_SHARED_LIBS from
# BR2_SHARED_LIBS/BR2_STATIC_LIBS and installs with install/fast; the
# project's tests cover that line (packager_builds_buildroot).
MIGRATE_SETTINGS_CONF_OPTS = -DBUILD_TESTING=OFF

$(eval $(cmake-package))
