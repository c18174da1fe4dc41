// The whole tool, as an installer runs it, on a real database and real capability files.

#include <set>

#include "rig.h"

namespace {

class Upgrade : public Appliance {
 protected:
  // Makes the example of an appliance, and a line for each transaction of an upgrade: threshold and
  // name of its action, and its text. Behind the SELECT of UpdateAxisA8105E the texts are not its
  // own; they have the same effect.
  void SetUp() override {
    Appliance::SetUp();
    RunCommand(R"sh(
      sqlite3 start.db <$S/examples/appliance.sql; cp start.db $D; cp $S/examples/KICapInfo/* $C
      axis=$(sqlite3 start.db "SELECT id FROM camera WHERE vendor='AXIS' AND model='A8105-E'")
      awk -F'\t' -v OFS='|' -v axis="$axis" '{
        n = $2 == "UpdateAxisA8105E" ? split(axis, id, "\n") : 1
        for (c = 1; c <= n; c++) for (i = c == 1 ? 3 : 4; i <= NF; i++)
          print $1, $2, $i (n == 1 || i == 3 ? "" : " AND id=" id[c])
      }' $S/tests/actions.tsv >texts)sh");
  }

  // Compares a run with what the sqlite3 shell makes of the same database. The case is a version,
  // the status, what makes the database, and a pattern of texts that fail in the tool only; an
  // action ends with a text that fails. Returns the status, behind all that is not alike.
  static string Compare(const Lines& Case) {
    return RunCommand("V=" + Case[0] + " failing='" + Case[3] + "' status=0\n{ " + Case[2] + R"sh(
      cp $D expected.db; } >out 2>&1
      { echo "tesselupgrader.cpp:main(): TESSEL pre-upgrade version: $V"
        while IFS='|' read -r threshold action text; do
          [ $threshold -gt $V ] && [ $action != "$failed" ] || continue
          [ "${text##$failing}" ] && sqlite3 expected.db "BEGIN;$text;COMMIT;" >out && continue
          failed=$action status=255 step="connect to db[0, $D]"
          [ ! -e $D ] || step="execute db[0] cmd: BEGIN;$text;COMMIT;"
          echo "kidb.cpp:Execute(): Failed to $step."
          echo "tesselupgrader.cpp:$action(): KiDBExecute command ($text) error."
        done <texts
      } >log.txt 2>out
      $T $V; [ $? = $status ] || echo "the status is not $status"
      sed -i -E 's/^.{15} \[[0-9]+\] ([^:]*:)[0-9]+:/\1/
        s/(SET connected_wire|INTO camdeviceoutput).*/\1/' $L log.txt; diff $L log.txt
      sqlite3 expected.db .dump >dump; sqlite3 "file:$D?nolock=1" .dump | diff - dump
      ls $D-* 2>out; echo $status; rm -f $D $L expected.db held; cp start.db $D)sh");
  }
};

TEST_F(Upgrade, EachThresholdSelectsItsActions) {
  const string strRun = "cut -d'|' -f3- texts | sed 's/;\\|$/;SELECT changes();/g' | sqlite3 $D";
  EXPECT_EQ(RunCommand(strRun + " | grep -x 0"), "") << "a text finds no camera in the example";
  for (const Lines& Action : ReadTable("actions.tsv")) {
    for (int Version = std::stoi(Action[0]) - 1; Version <= std::stoi(Action[0]) + 1; ++Version) {
      EXPECT_EQ(Compare({std::to_string(Version), "0", "cp start.db $D", ""}), "0\n") << Version;
    }
  }
}

// The example's database is changed, the recorder holds it, or it refuses a text.
TEST_F(Upgrade, HostileDatabases) {
  for (const Lines& Row : ReadTable("databases.tsv")) {
    EXPECT_EQ(Compare(Row), Row[1] + "\n") << Row[2];
  }
}

TEST_F(Upgrade, CorruptPageIsAnErrorOrDoesNotMatter) {
  const string strDd = "dd if=/dev/urandom bs=4096 count=1 conv=notrunc of=$D seek=";
  std::set<string> Ends;
  for (size_t Page = 0; Page < fs::file_size("/var/start.db") / 4096; ++Page) {
    Ends.insert(Compare({"0", "0 or 255", strDd + std::to_string(Page), ""}));
  }
  EXPECT_EQ(Ends, (std::set<string>{"0\n", "255\n"}));
}

// Each command line follows a preparation, and goes on where the one before ended.
TEST_F(Upgrade, CommandLines) {
  RunCommand("rm $C/*");
  for (const Lines& Row : ReadTable("commandlines.tsv")) {
    const string strRun = "cp start.db $D; rm -f $L\n" + Row[0] + "\n{ $T " + Row[1];
    EXPECT_EQ(RunCommand(strRun + R"sh( 2>out; echo $?; cmp -s $D start.db || echo changed
        cat $L $C/camera 2>out | sed 's/.*: //'; } | sed 's/r [0-9.]*$/r VERSION/')sh"),
              Row[2])
        << Row[1];
  }
}

TEST_F(Upgrade, CapabilityFilesChangeByTheirOwnKeys) {
  const SyslogSocket Socket;
  // As many bytes as are used of a name: what is behind them is cut off.
  const string strIs = RunCommand(R"sh(
      dir=/var/$(printf %0250d/%0255d); mkdir -p $dir/dir; cd $dir
      echo pan=yes | tee a c secret "new$(printf '\nline')" $(printf %0255d) >/var/pan; cp c big
      echo ptz_continuous_move=yes | cat - a >b; head -c 99999 /dev/urandom | tr = x >/var/head
      { cat /var/head; echo; cat b; } >binary; truncate -s 100M big; chmod 400 a; chmod 0 secret
      mkfifo fifo; ln -s /var/pan link; ln -s /dev/zero device; ln -s /dev/log socket
      ln -s loop loop; ln -s none dangling
      setpriv --bounding-set -all $T --updateCap ${dir}x; echo $?
      ls -AF | sed s/000*/00/ | paste -sd ' '; head -c 99999 binary | cmp - /var/head
      for file in a 0* b c link new* secret big binary; do tail -n 2 "$file" | tr -d '\0'; done |
        sed s/pan=// | paste -sd '|'; ls /var/log/camveld)sh");
  EXPECT_EQ(strIs,
            "0\n00 a b big binary c dangling@ device@ dir/ fifo| link@ loop@ new line secret "
            "socket@\n step| step| continuous|ptz_speed_max = 1| step| step| step|yes|yes|"
            " continuous|ptz_speed_max = 1\n");
}

TEST_F(Upgrade, CapabilityFileThatCannotBeReadStaysAlone) {
  for (const string strCall : {"%%stat", "openat", "read"}) {
    const string strRun = "rm $C/*; echo pan=yes | tee $C/a $C/b >$C/c\n";
    EXPECT_EQ(RunCommand(strRun + "ASAN_OPTIONS=detect_leaks=0 strace -fo trace -P $C/b -e " +
                         "inject=" + strCall + ":error=EIO:when=1 $T --updateCap $C; echo $?;" +
                         "cat $C/*; grep -c INJECTED trace"),
              "0\npan= step\npan=yes\npan= step\n1\n")
        << strCall;
  }
}

// EINVAL says that the file system cannot sync directories.
TEST_F(Upgrade, OnlyAFailedSyncOfTheDirectoryStopsTheWalk) {
  for (const auto& [strErrno, strEnd] :
       {std::pair("EINVAL", "0\n2\n"), {"EIO", "255\n1\n"}, {"ENOSPC", "255\n1\n"}}) {
    const string strRun = "rm $C/*; echo ptz_continuous_move=yes | tee $C/a >$C/b\n";
    EXPECT_EQ(RunCommand(strRun + "ASAN_OPTIONS=detect_leaks=0 strace -fo trace -P $C" +
                         " -e inject=fsync:error=" + strErrno +
                         " $T --updateCap $C; echo $?; find $C -type f -empty | wc -l"),
              strEnd);
  }
}

TEST_F(Upgrade, LargeCapabilityDirectoryThatOthersChange) {
  const string strIs = RunCommand(R"sh(
      rm $C/*; cd $C; seq 100000 | xargs touch; echo pan=yes | tee a z >/var/pan
      while [ -e a ]; do echo pan=yes >b; mv b c; rm c; done &
      $T --updateCap $C; echo $?; cat a z; rm a; ls | grep -vc '[bc]')sh");
  EXPECT_EQ(strIs, "0\npan= step\npan= step\n100001\n");
}

// Cameras change twice in one transaction: what a statement may have to take back is in memory.
TEST_F(Upgrade, WritesOnlyItsFiles) {
  const string strIs = RunCommand(R"sh(
      sqlite3 $D "INSERT INTO camera (vendor, model, resolution, live_resolution)
        SELECT 'FOSCAM', 'R4', '2048x1536', '2048x1536' FROM generate_series(1, 300)"
      ASAN_OPTIONS=detect_leaks=0 strace -fo trace -e %file $T 0; echo $?
      grep -E ' open.*O_(WRONLY|RDWR|CREAT)| (rename|unlink|link|sym|mk|trunc|ch)' trace |
        cut -d '"' -f 2 | grep -v ^/tmp/tsan | LC_ALL=C sort -u >written # but ThreadSanitizer's
      printf '%s\n' $L $C/.zamoc.tmp $D $D-journal | diff written -)sh");
  EXPECT_EQ(strIs, "0\n");
}

TEST_F(Upgrade, ValgrindFindsNothing) {
  if (sizeof(TESSEL_SANITIZE TESSEL_EMULATOR) > 1) {
    GTEST_SKIP() << "Valgrind runs neither sanitized nor foreign programs";
  }
  EXPECT_EQ(RunCommand("valgrind -q --error-exitcode=99 --leak-check=full $T 0; echo $?"), "0\n");
}

}  // namespace
