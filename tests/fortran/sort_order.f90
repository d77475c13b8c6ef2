! SORTFILE from Fortran: records of 4 values (a numeric key, a 12-byte string
! over values 2 and 3, the record's input number) sorted by the numeric key
! descending, then the string ascending; checked for order, stability and
! completeness. Then the return codes of an output function that stops at
! once and of an input that is empty at once.
module order_state
  use isort_api
  implicit none
  integer(c_int32_t), parameter :: nrec = 4000, width = 4
  real(c_double) :: records(width, nrec), sorted(width, nrec)
  integer(c_int32_t) :: nread = 0, nwritten = 0, outcalls = 0, badcontext = 0

contains

  ! The string of record i: letters from a small alphabet and trailing blanks.
  function text_of(i) result(s)
    integer(c_int32_t), intent(in) :: i
    character(len=16) :: s
    character(len=3), parameter :: alphabet = 'ABC'
    integer :: k, n
    s = repeat(' ', 16)
    n = mod(i * 37, 5)
    do k = 1, n
      s(k:k) = alphabet(mod(i * k * 13, 3) + 1:mod(i * k * 13, 3) + 1)
    end do
    s(13:16) = 'wxyz'  ! beyond the key's 12 bytes: carried, not compared
  end function

  integer(c_int32_t) function give(context, buffer, nvars) bind(c)
    integer(c_int32_t), intent(inout) :: context
    integer(c_int32_t), intent(in) :: nvars
    real(c_double), intent(out) :: buffer(nvars)
    if (context /= 4711) badcontext = badcontext + 1
    if (nread >= nrec) then
      give = 1
      return
    end if
    nread = nread + 1
    buffer = records(:, nread)
    give = 0
  end function

  integer(c_int32_t) function take(context, record, nvars) bind(c)
    integer(c_int32_t), intent(inout) :: context
    integer(c_int32_t), intent(in) :: nvars
    real(c_double), intent(in) :: record(nvars)
    if (context /= 4711) badcontext = badcontext + 1
    nwritten = nwritten + 1
    if (nwritten <= nrec) sorted(:, nwritten) = record
    take = 0
  end function

  integer(c_int32_t) function stop_at_once(context, record, nvars) bind(c)
    integer(c_int32_t), intent(inout) :: context
    integer(c_int32_t), intent(in) :: nvars
    real(c_double), intent(in) :: record(nvars)
    if (context /= 4711 .or. nvars /= width .or. size(record) /= width) badcontext = badcontext + 1
    outcalls = outcalls + 1
    stop_at_once = 7
  end function

  integer(c_int32_t) function nothing(context, buffer, nvars) bind(c)
    integer(c_int32_t), intent(inout) :: context
    integer(c_int32_t), intent(in) :: nvars
    real(c_double), intent(inout) :: buffer(nvars)
    if (context /= 4711 .or. size(buffer) /= width) badcontext = badcontext + 1
    nothing = 1
  end function
end module

program sort_order
  use order_state
  implicit none
  integer(c_int32_t) :: context, code, i, nukeys, nvars
  integer(c_int32_t) :: ukeys(6)
  logical :: seen(nrec)
  character(len=16) :: s, t
  character(len=12) :: p, q

  do i = 1, nrec
    records(1, i) = real(mod(i * 7919, 11), c_double)
    records(2:3, i) = transfer(text_of(i), 0.0_c_double, 2)
    records(4, i) = real(i, c_double)
  end do

  ! Key array: variables 1 and 2; directions -1 (descending) and 1; widths 0 and 12.
  ukeys = [1, 2, -1, 1, 0, 12]
  nukeys = 2
  nvars = width
  context = 4711
  code = sort_checked(context, c_funloc(give), c_funloc(take), nvars, ukeys, nukeys, 'sort')
  call check(code == 0, 'sort returns 0')
  call check(badcontext == 0, 'callbacks get the context and nvars')
  call check(nwritten == nrec, 'every record comes out')

  seen = .false.
  do i = 1, nrec
    call check(.not. seen(int(sorted(4, i))), 'no record twice')
    seen(int(sorted(4, i))) = .true.
    s = transfer(sorted(2:3, i), s)
    call check(s == text_of(int(sorted(4, i), c_int32_t)), 'values travel with their record')
  end do
  ! Keys and record numbers are whole numbers: compared as integers.
  do i = 2, nrec
    s = transfer(sorted(2:3, i), s)
    t = transfer(sorted(2:3, i - 1), t)
    p = t(1:12)
    q = s(1:12)
    if (int(sorted(1, i - 1)) /= int(sorted(1, i))) then
      call check(int(sorted(1, i - 1)) > int(sorted(1, i)), 'numeric key descending')
    else if (p /= q) then
      call check(llt(p, q), 'string key ascending')
    else
      call check(int(sorted(4, i - 1)) < int(sorted(4, i)), 'equal keys keep input order')
    end if
  end do
  call check(all(seen), 'every record once')

  ! An output function that returns 7 stops the sort at the first record.
  nread = 0
  code = sort_checked(context, c_funloc(give), c_funloc(stop_at_once), nvars, ukeys, nukeys, 'stop')
  call check(code == 7, 'output result 7 is returned')
  call check(outcalls == 1, 'output is not called again')

  ! An input that is exhausted at once: no output, result 0.
  outcalls = 0
  code = sort_checked(context, c_funloc(nothing), c_funloc(stop_at_once), nvars, ukeys, nukeys, 'empty input')
  call check(code == 0, 'empty input gives 0')
  call check(outcalls == 0, 'empty input calls no output')
  call check(badcontext == 0, 'callbacks get the context and nvars')
  print '(a)', 'sort_order: all checks passed'
end program
